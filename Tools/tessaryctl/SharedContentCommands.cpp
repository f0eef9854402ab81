#include "Tools/tessaryctl/Commands.h"
#include "Tools/tessaryctl/Finish.h"

using tessary::Client;

namespace command {

int stageSharedContent(Client& client, const Options& options) {
  return finish(client.stageSharedContent(options.identifier.value_or(""), options.source,
                                          options.destination),
                [&](const std::string& path) { options.output.print("path", path); });
}

int assetsPath(Client& client, const Options& options) {
  return finish(client.userManagedAssetsPath(options.identifier.value_or(""), options.assets),
                [&](const auto& assets) { options.output.print(assets); });
}

int deleteAsset(Client& client, const Options& options) {
  return finish(client.deleteUserManagedAsset(options.identifier.value_or(""), options.source));
}

}  // namespace command

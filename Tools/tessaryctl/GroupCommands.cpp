#include "Tools/tessaryctl/Commands.h"
#include "Tools/tessaryctl/Finish.h"

using tessary::Client;

namespace command {

int groups(Client& client, const Options& options) {
  return finish(client.groupContainers(options.identifier),
                [&](const auto& containers) { options.output.print(containers); });
}

int groupIdentifiers(Client& client, const Options& options) {
  return finish(client.groupIdentifiers(options.identifier),
                [&](const auto& texts) { options.output.print("groups", texts); });
}

int systemGroups(Client& client, const Options& options) {
  return finish(client.systemGroupContainers(options.identifier),
                [&](const auto& containers) { options.output.print(containers); });
}

int systemGroupPath(Client& client, const Options& options) {
  return finish(client.systemGroupContainerPath(options.owner, options.identifier.value_or("")),
                [&](const std::string& path) { options.output.print("path", path); });
}

}  // namespace command

#include "Client/Client.h"
#include "Client/Wire.h"

using platform::ipc::Message;

namespace tessary {

Result<std::string> Client::stageSharedContent(const std::string& group, const std::string& source,
                                               const std::string& destination) {
  Message request;
  request.set("Identifier", group);
  request.set("SourcePath", source);
  request.set("DestPath", destination);
  return callForPath(kStageSharedContent, std::move(request));
}

Result<UserManagedAssets> Client::userManagedAssetsPath(const std::string& identifier,
                                                        const UserManagedAssetsOptions& options) {
  Message request;
  request.set("Identifier", identifier);
  request.set("IsRelative", options.isRelative);
  request.set("CreateIfNecessary", options.createIfNecessary);
  const auto reply = call(kUserManagedAssetsPath, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  const std::string* path = reply->string("ReplyPath");
  const auto existed = reply->boolean("ReplyExisted");
  if (path == nullptr) return missing("ReplyPath");
  if (!existed) return missing("ReplyExisted");
  return UserManagedAssets{.path = *path, .existed = *existed};
}

Result<void> Client::deleteUserManagedAsset(const std::string& identifier,
                                            const std::string& relativePath) {
  Message request;
  request.set("Identifier", identifier);
  request.set("SourcePath", relativePath);
  return callForNothing(kDeleteUserManagedAsset, std::move(request));
}

}  // namespace tessary

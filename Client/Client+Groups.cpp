#include "Client/Client.h"
#include "Client/Wire.h"

using platform::Value;
using platform::ipc::Message;

namespace tessary {
namespace {

constexpr char kPaths[] = "ReplyGroupContainerDict";

Message requestFor(const std::optional<std::string>& owner) {
  Message request;
  if (owner) request.set("Identifier", *owner);
  return request;
}

// What a dictionary that may be missing has for a group.
std::optional<std::string> ofGroup(const Message& reply, std::string_view key,
                                   const std::string& group) {
  const Value* dictionary = reply.value(key);
  const Value* value = dictionary == nullptr ? nullptr : dictionary->find(group);
  const std::string* text = value == nullptr ? nullptr : value->asString();
  return text == nullptr ? std::nullopt : std::optional(*text);
}

}  // namespace

Result<std::vector<GroupContainer>> Client::callForGroups(uint64_t command,
                                                          const std::optional<std::string>& owner) {
  const auto reply = call(command, requestFor(owner));
  if (!reply) return std::unexpected(reply.error());
  const Value::Dictionary* paths = reply->dictionary(kPaths);
  if (paths == nullptr) return missing(kPaths);
  std::vector<GroupContainer> containers;
  containers.reserve(paths->size());
  for (const auto& [group, path] : *paths) {
    if (path.asString() == nullptr) return missing(kPaths);
    containers.push_back(
        {.identifier = group,
         .path = *path.asString(),
         .personaUniqueString = ofGroup(*reply, "ReplyPersonaUniqueStringDict", group),
         .sandboxToken = ofGroup(*reply, "ReplySandboxTokenDict", group)});
  }
  return containers;
}

Result<std::vector<GroupContainer>> Client::groupContainers(
    const std::optional<std::string>& owner) {
  return callForGroups(kGroupContainersForOwner, owner);
}

Result<std::vector<GroupContainer>> Client::systemGroupContainers(
    const std::optional<std::string>& owner) {
  return callForGroups(kSystemGroupContainersForOwner, owner);
}

Result<std::vector<std::string>> Client::groupIdentifiers(const std::optional<std::string>& owner) {
  return callForStrings(kGroupIdentifiersForOwner, requestFor(owner), "ReplyGroupIdentifiersArray");
}

Result<std::string> Client::systemGroupContainerPath(const std::optional<std::string>& owner,
                                                     const std::string& group) {
  Message request = requestFor(owner);
  request.set("GroupIdentifier", group);
  return callForPath(kSystemGroupContainerPath, std::move(request));
}

}  // namespace tessary

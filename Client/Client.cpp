#include "Client/Client.h"

#include <fmt/format.h>

using platform::UUID;
using platform::Value;
using platform::ipc::Channel;
using platform::ipc::Message;

namespace tessary {
namespace {

constexpr char kSocket[] = "/run/tessary/com.veltra.tessaryd";
constexpr uint64_t kSuccess = 1;

enum Command : uint64_t {
  kCreateOrLookup = 0,
  kContainersOfClass = 1,
  kSystemContainerPath = 15,
  kRetired = 27,
  kPersonaList = 32,
};

std::unexpected<Error> missing(std::string_view key) {
  return std::unexpected(Error{.kind = Error::Kind::protocol,
                               .code = 0,
                               .text = fmt::format("the reply has no valid \"{}\"", key)});
}

std::optional<std::string> optionalString(const Message& reply, std::string_view key) {
  const std::string* value = reply.string(key);
  return value == nullptr ? std::nullopt : std::optional(*value);
}

// The strings of an array; none when there is no array or something else is in it.
std::optional<std::vector<std::string>> strings(const Message& reply, std::string_view key) {
  const Value::Array* array = reply.array(key);
  if (array == nullptr) return std::nullopt;
  std::vector<std::string> list;
  list.reserve(array->size());
  for (const Value& element : *array) {
    if (element.asString() == nullptr) return std::nullopt;
    list.push_back(*element.asString());
  }
  return list;
}

}  // namespace

Result<Client> Client::connect(const std::string& root) {
  const std::string path = (root == "/" ? std::string() : root) + kSocket;
  auto channel = Channel::connect(path);
  if (!channel) {
    return std::unexpected(
        Error{.kind = Error::Kind::transport, .code = 0, .text = channel.error().reason});
  }
  return Client(std::move(*channel));
}

Result<Message> Client::call(uint64_t command, Message request) {
  request.set("Command", command);
  auto reply = channel_.call(request);
  if (!reply) {
    return std::unexpected(
        Error{.kind = Error::Kind::transport, .code = 0, .text = reply.error().reason});
  }
  const auto code = reply->uint64("ReplyError");
  if (!code) return missing("ReplyError");
  if (*code != kSuccess) {
    return std::unexpected(
        Error{.kind = Error::Kind::daemon, .code = *code, .text = std::string(errorName(*code))});
  }
  return std::move(*reply);
}

Result<Container> Client::createOrLookup(const std::optional<std::string>& identifier,
                                         ContainerClass containerClass,
                                         const CreateOrLookupOptions& options) {
  Message request;
  if (identifier) request.set("Identifier", *identifier);
  request.set("ContainerClass", containerClass);
  request.set("CreateIfNecessary", options.createIfNecessary);
  request.set("Transient", options.transient);
  const auto reply = call(kCreateOrLookup, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  const UUID* uuid = reply->uuid("ReplyUUID");
  const std::string* path = reply->string("ReplyPath");
  const std::string* replyIdentifier = reply->string("ReplyIdentifier");
  const auto existed = reply->boolean("ReplyExisted");
  if (uuid == nullptr) return missing("ReplyUUID");
  if (path == nullptr) return missing("ReplyPath");
  if (replyIdentifier == nullptr) return missing("ReplyIdentifier");
  if (!existed) return missing("ReplyExisted");
  return Container{.uuid = *uuid,
                   .identifier = *replyIdentifier,
                   .path = *path,
                   .existed = *existed,
                   .personaUniqueString = optionalString(*reply, "ReplyPersonaUniqueString"),
                   .sandboxToken = optionalString(*reply, "ReplySandboxToken")};
}

Result<std::vector<ListedContainer>> Client::containersOfClass(ContainerClass containerClass,
                                                               bool transient) {
  Message request;
  request.set("ContainerClass", containerClass);
  request.set("Transient", transient);
  const auto reply = call(kContainersOfClass, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  const auto identifiers = strings(*reply, "ReplyIdsArray");
  const auto personas = strings(*reply, "ReplyPersonaUniqueStringsArray");
  const Value::Array* uuids = reply->array("ReplyUUIDsArray");
  if (!identifiers) return missing("ReplyIdsArray");
  if (!personas || personas->size() != identifiers->size()) {
    return missing("ReplyPersonaUniqueStringsArray");
  }
  if (uuids == nullptr || uuids->size() != identifiers->size()) return missing("ReplyUUIDsArray");
  std::vector<ListedContainer> containers;
  containers.reserve(identifiers->size());
  for (size_t i = 0; i < identifiers->size(); ++i) {
    const UUID* uuid = (*uuids)[i].asUUID();
    if (uuid == nullptr) return missing("ReplyUUIDsArray");
    containers.push_back({(*identifiers)[i], *uuid, (*personas)[i]});
  }
  return containers;
}

Result<std::string> Client::systemContainerPath(const std::optional<std::string>& identifier) {
  Message request;
  if (identifier) request.set("Identifier", *identifier);
  const auto reply = call(kSystemContainerPath, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  const std::string* path = reply->string("ReplyPath");
  if (path == nullptr) return missing("ReplyPath");
  return *path;
}

Result<void> Client::retired() {
  const auto reply = call(kRetired, Message());
  if (!reply) return std::unexpected(reply.error());
  return {};
}

Result<std::vector<std::string>> Client::personaList() {
  const auto reply = call(kPersonaList, Message());
  if (!reply) return std::unexpected(reply.error());
  auto personas = strings(*reply, "ReplyPersonaUniqueStringsArray");
  if (!personas) return missing("ReplyPersonaUniqueStringsArray");
  return std::move(*personas);
}

}  // namespace tessary

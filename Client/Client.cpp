#include "Client/Client.h"

#include "Client/Wire.h"

using platform::UUID;
using platform::Value;
using platform::ipc::Channel;
using platform::ipc::Message;

namespace tessary {
namespace {

constexpr char kSocket[] = "/run/tessary/com.veltra.tessaryd";
constexpr uint64_t kSuccess = 1;

Message requestFor(const ContainerName& container) {
  Message request;
  request.set("Identifier", container.identifier);
  request.set("ContainerClass", container.containerClass);
  request.set("UUID", container.uuid);
  if (container.personaUniqueString) {
    request.set("PersonaUniqueString", *container.personaUniqueString);
  }
  return request;
}

// The keys of a replace, which name two containers.
void setPrefixed(Message& request, const std::string& prefix, const ContainerName& container) {
  request.set(prefix + "Identifier", container.identifier);
  request.set(prefix + "ContainerClass", container.containerClass);
  request.set(prefix + "ContainerUUID", container.uuid);
  if (container.personaUniqueString) {
    request.set(prefix + "PersonaUniqueString", *container.personaUniqueString);
  }
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

Result<void> Client::callForNothing(uint64_t command, Message request) {
  const auto reply = call(command, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  return {};
}

Result<std::string> Client::callForPath(uint64_t command, Message request) {
  const auto reply = call(command, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  const std::string* path = reply->string("ReplyPath");
  if (path == nullptr) return missing("ReplyPath");
  return *path;
}

Result<std::vector<std::string>> Client::callForStrings(uint64_t command, Message request,
                                                        std::string_view key) {
  const auto reply = call(command, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  auto list = strings(*reply, key);
  if (!list) return missing(key);
  return *std::move(list);
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

Result<void> Client::replaceContainer(const ContainerName& old, const ContainerName& replacement) {
  Message request;
  setPrefixed(request, "Old", old);
  setPrefixed(request, "New", replacement);
  return callForNothing(kReplaceContainer, std::move(request));
}

Result<void> Client::promoteContainer(const ContainerName& transient) {
  Message request;
  setPrefixed(request, "New", transient);
  request.set("OldIdentifier", transient.identifier);
  request.set("OldContainerClass", transient.containerClass);
  if (transient.personaUniqueString) {
    request.set("OldPersonaUniqueString", *transient.personaUniqueString);
  }
  return callForNothing(kReplaceContainer, std::move(request));
}

Result<void> Client::stageForDelete(const std::vector<ContainerName>& containers) {
  Value::Array classes;
  Value::Array uuids;
  Value::Array identifiers;
  Value::Array personas;
  for (const ContainerName& container : containers) {
    classes.emplace_back(container.containerClass);
    uuids.emplace_back(container.uuid);
    identifiers.emplace_back(container.identifier);
    personas.emplace_back(container.personaUniqueString.value_or(""));
  }
  Message request;
  request.set("ContainerClassesArray", std::move(classes));
  request.set("UUIDsArray", std::move(uuids));
  request.set("IdentifiersArray", std::move(identifiers));
  request.set("PersonaUniqueStringsArray", std::move(personas));
  return callForNothing(kStageForDelete, std::move(request));
}

Result<void> Client::emptyDeathRow() {
  return callForNothing(kEmptyDeathRow, Message());
}

Result<void> Client::deleteContainer(const std::string& identifier, ContainerClass containerClass,
                                     bool transient) {
  Message request;
  request.set("Identifier", identifier);
  request.set("ContainerClass", containerClass);
  request.set("Transient", transient);
  return callForNothing(kDeleteContainer, std::move(request));
}

Result<void> Client::wipePluginData(const std::string& identifier) {
  Message request;
  request.set("Identifier", identifier);
  return callForNothing(kWipePluginData, std::move(request));
}

Result<void> Client::deleteDataContent(const std::string& identifier,
                                       ContainerClass containerClass) {
  Message request;
  request.set("Identifier", identifier);
  request.set("ContainerClass", containerClass);
  return callForNothing(kDeleteDataContent, std::move(request));
}

Result<void> Client::setInfoValue(const ContainerName& container, const std::string& key,
                                  const std::optional<Value>& value) {
  Message request = requestFor(container);
  request.set("Key", key);
  if (value) request.set("Value", *value);
  return callForNothing(kSetInfoValue, std::move(request));
}

Result<Value> Client::infoValue(const ContainerName& container, const std::string& key) {
  Message request = requestFor(container);
  request.set("Key", key);
  const auto reply = call(kGetInfoValue, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  const Value* value = reply->value("ReplyInfoValue");
  if (value == nullptr) return missing("ReplyInfoValue");
  return *value;
}

Result<Metadata> Client::metadata(const ContainerName& container, bool infoRequested) {
  Message request = requestFor(container);
  request.set("InfoDictRequested", infoRequested);
  const auto reply = call(kGetMetadata, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  const std::string* path = reply->string("ReplyPath");
  const auto transient = reply->boolean("ReplyTransient");
  const Value::Dictionary* info = reply->dictionary("ReplyInfoDictionary");
  if (path == nullptr) return missing("ReplyPath");
  if (!transient) return missing("ReplyTransient");
  return Metadata{.path = *path,
                  .transient = *transient,
                  .info = info == nullptr ? std::nullopt : std::optional(*info),
                  .personaUniqueString = optionalString(*reply, "ReplyPersonaUniqueString"),
                  .sandboxToken = optionalString(*reply, "ReplySandboxToken")};
}

Result<void> Client::recreateStructure(const ContainerName& container) {
  return callForNothing(kRecreateStructure, requestFor(container));
}

Result<void> Client::regenerateUUID(const ContainerName& container) {
  return callForNothing(kRegenerateUUID, requestFor(container));
}

Result<uint64_t> Client::diskUsage(const ContainerName& container) {
  const auto reply = call(kDiskUsage, requestFor(container));
  if (!reply) return std::unexpected(reply.error());
  const auto bytes = reply->uint64("ReplyDiskUsage");
  if (!bytes) return missing("ReplyDiskUsage");
  return *bytes;
}

Result<std::string> Client::systemContainerPath(const std::optional<std::string>& identifier) {
  Message request;
  if (identifier) request.set("Identifier", *identifier);
  return callForPath(kSystemContainerPath, std::move(request));
}

Result<void> Client::retired() {
  return callForNothing(kRetired, Message());
}

Result<std::vector<std::string>> Client::personaList() {
  return callForStrings(kPersonaList, Message(), "ReplyPersonaUniqueStringsArray");
}

}  // namespace tessary

// libtessary: the container daemon's client library, one blocking call per command.
//
// A Client is one connection. It is not for use by two threads at once; connect one per thread.
// What a caller may do is decided by the daemon from the identity and the entitlements of his
// process. Every call fails with the daemon's code, or with one of the library's own below when the
// daemon cannot be asked.
#pragma once

#include <cstdint>
#include <expected>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/ipc/Channel.h"
#include "Platform/ipc/Message.h"
#include "Platform/values/UUID.h"

namespace tessary {

struct Error {
  enum class Kind {
    daemon,     // the daemon said no: `code` is its "ReplyError"
    transport,  // it cannot be reached, or the connection broke
    protocol,   // its reply lacks what the command promises
  };
  Kind kind;
  uint64_t code = 0;
  std::string text;
};

template <typename T>
using Result = std::expected<T, Error>;

// A container's class, 1 to 13.
using ContainerClass = uint64_t;

struct Container {
  platform::UUID uuid;
  std::string identifier;
  std::string path;
  bool existed = false;  // found, not made by this call
  std::optional<std::string> personaUniqueString;
  // For a sandboxed caller's enterprise container: what opens its path to him.
  std::optional<std::string> sandboxToken;
};

struct ListedContainer {
  std::string identifier;
  platform::UUID uuid;
  std::string personaUniqueString;  // empty without a persona
};

// One very container.
struct ContainerName {
  std::string identifier;
  ContainerClass containerClass = 0;
  platform::UUID uuid;
  // For a class under a user's home; ignored for others.
  std::optional<std::string> personaUniqueString;
};

struct Metadata {
  std::string path;
  bool transient = false;
  std::optional<platform::Value::Dictionary> info;  // when it was asked for and is there
  std::optional<std::string> personaUniqueString;
  std::optional<std::string> sandboxToken;
};

struct CreateOrLookupOptions {
  bool createIfNecessary = false;
  bool transient = false;
};

// A container that is shared by the members of a group.
struct GroupContainer {
  std::string identifier;  // the group's
  std::string path;
  // These two only for a sandboxed caller, as in Container.
  std::optional<std::string> personaUniqueString;
  std::optional<std::string> sandboxToken;
};

struct RegistrationOptions {
  // Of the data container that belongs to the identifier; 0 for none.
  ContainerClass dataContainerClass = 0;
  // The identifier is a plug-in of this application, which must be registered already.
  std::optional<std::string> parentIdentifier = std::nullopt;
  // What is not installed yet: it counts as a member of its groups, and codeSigningInfo() does not
  // answer it. An advance copy is forgotten when the device starts again.
  bool placeholder = false;
  bool advanceCopy = false;
  // A later registration by the identifier's own process may change it.
  bool registeredByCaller = false;
};

struct UserManagedAssetsOptions {
  bool isRelative = false;  // to the container's directory
  bool createIfNecessary = false;
};

struct UserManagedAssets {
  std::string path;
  bool existed = false;  // found, not made by this call
};

// The short name of a daemon's code, such as "TSYErrorNotFound"; empty for an unknown one.
std::string_view errorName(uint64_t code);
// What the code means, in a few words; empty for an unknown one.
std::string_view errorMessage(uint64_t code);

// Where code-signing information holds the entitlements.
inline constexpr char kEntitlementsKey[] = "com.veltra.Tessary.Entitlements";

class Client {
 public:
  // `root` is the directory that stands for "/".
  static Result<Client> connect(const std::string& root = "/");

  // Without an identifier: the caller's own.
  Result<Container> createOrLookup(const std::optional<std::string>& identifier,
                                   ContainerClass containerClass,
                                   const CreateOrLookupOptions& options = {});
  Result<std::vector<ListedContainer>> containersOfClass(ContainerClass containerClass,
                                                         bool transient = false);
  // Puts `replacement` in the place of `old`, whose content is deleted.
  Result<void> replaceContainer(const ContainerName& old, const ContainerName& replacement);
  // Makes a transient container the regular one of its identifier; there must be none yet.
  Result<void> promoteContainer(const ContainerName& transient);
  // Takes all of them out of sight; the room they take is free when death row has been emptied.
  Result<void> stageForDelete(const std::vector<ContainerName>& containers);
  // Returns when death row has been emptied.
  Result<void> emptyDeathRow();
  Result<void> deleteContainer(const std::string& identifier, ContainerClass containerClass,
                               bool transient = false);
  // The content of a plug-in's data container, or of any container under a user's home.
  Result<void> wipePluginData(const std::string& identifier);
  Result<void> deleteDataContent(const std::string& identifier, ContainerClass containerClass);

  // Without a value: removes the key.
  Result<void> setInfoValue(const ContainerName& container, const std::string& key,
                            const std::optional<platform::Value>& value);
  Result<platform::Value> infoValue(const ContainerName& container, const std::string& key);
  Result<Metadata> metadata(const ContainerName& container, bool infoRequested);
  // Makes missing directories of the container's default structure anew.
  Result<void> recreateStructure(const ContainerName& container);
  // Gives the container's directory a new name.
  Result<void> regenerateUUID(const ContainerName& container);
  // In bytes.
  Result<uint64_t> diskUsage(const ContainerName& container);

  // The path of a system container (class 12), which is made when it is not there. Without an
  // identifier: the caller's own.
  Result<std::string> systemContainerPath(const std::optional<std::string>& identifier);

  // The groups below are those in the entitlements that are registered for the owner; without one
  // the caller is the owner. Another owner than the caller takes a right to look it up.

  // The containers of the owner's application groups (class 7), and of his system groups (class
  // 13). Those that are not there are made.
  Result<std::vector<GroupContainer>> groupContainers(
      const std::optional<std::string>& owner = std::nullopt);
  Result<std::vector<GroupContainer>> systemGroupContainers(
      const std::optional<std::string>& owner = std::nullopt);
  // The owner's application groups; makes nothing. Takes an entitlement, for one's own too.
  Result<std::vector<std::string>> groupIdentifiers(
      const std::optional<std::string>& owner = std::nullopt);
  // The container of one system group, which is made when it is not there. The group must be one of
  // the caller's own and of the owner's, or a well-known one.
  Result<std::string> systemGroupContainerPath(const std::optional<std::string>& owner,
                                               const std::string& group);

  // The next three are for those who install.

  // What an identifier is entitled to, in place of what was registered before; its entitlements
  // stand under kEntitlementsKey. Without information the identifier is forgotten. An application
  // group that nobody names any more and a system container that is given up lose their content.
  Result<void> registerCodeSigningInfo(const std::string& identifier,
                                       const std::optional<platform::Value::Dictionary>& info,
                                       const RegistrationOptions& options = {});
  Result<platform::Value::Dictionary> codeSigningInfo(const std::string& identifier);
  // The entries of applications without a bundle container: codeSigningInfo() answers them no more.
  Result<void> invalidateCodeSigningInfo();

  // Moves an item within the container of a system group of the caller's own; the paths are
  // relative to the container. Returns where the item is now. Takes stageSharedContent.
  Result<std::string> stageSharedContent(const std::string& group, const std::string& source,
                                         const std::string& destination);
  // Where an application keeps, in its data container, what its user manages. The caller's own, or
  // anyone's with userManagedAssets. Code 71 when there is none and createIfNecessary is false.
  Result<UserManagedAssets> userManagedAssetsPath(const std::string& identifier,
                                                  const UserManagedAssetsOptions& options = {});
  // Deletes one item in there. Takes userManagedAssets, for one's own too.
  Result<void> deleteUserManagedAsset(const std::string& identifier,
                                      const std::string& relativePath);

  // A command that there was once: always fails with 49.
  Result<void> retired();
  // The unique strings of the personas that the caller may see.
  Result<std::vector<std::string>> personaList();

  // Sends any command and returns the reply of a success.
  Result<platform::ipc::Message> call(uint64_t command, platform::ipc::Message request);

 private:
  // A command whose reply carries nothing.
  Result<void> callForNothing(uint64_t command, platform::ipc::Message request);
  // Commands that reply one path, strings under `key`, or the containers of groups.
  Result<std::string> callForPath(uint64_t command, platform::ipc::Message request);
  Result<std::vector<std::string>> callForStrings(uint64_t command, platform::ipc::Message request,
                                                  std::string_view key);
  Result<std::vector<GroupContainer>> callForGroups(uint64_t command,
                                                    const std::optional<std::string>& owner);

  explicit Client(platform::ipc::Channel channel) : channel_(std::move(channel)) {}

  platform::ipc::Channel channel_;
};

}  // namespace tessary

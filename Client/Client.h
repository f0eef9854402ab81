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

struct CreateOrLookupOptions {
  bool createIfNecessary = false;
  bool transient = false;
};

// The short name of a daemon's code, such as "TSYErrorNotFound"; empty for an unknown one.
std::string_view errorName(uint64_t code);
// What the code means, in a few words; empty for an unknown one.
std::string_view errorMessage(uint64_t code);

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
  // The path of a system container (class 12), which is made when it is not there. Without an
  // identifier: the caller's own.
  Result<std::string> systemContainerPath(const std::optional<std::string>& identifier);
  // A command that there was once: always fails with 49.
  Result<void> retired();
  // The unique strings of the personas that the caller may see.
  Result<std::vector<std::string>> personaList();

  // Sends any command and returns the reply of a success.
  Result<platform::ipc::Message> call(uint64_t command, platform::ipc::Message request);

 private:
  explicit Client(platform::ipc::Channel channel) : channel_(std::move(channel)) {}

  platform::ipc::Channel channel_;
};

}  // namespace tessary

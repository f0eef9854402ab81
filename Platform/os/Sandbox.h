// The kernel sandbox: container path mappings and file extension tokens.
//
// Mappings go to an append-only text log, run/tessary/sandbox/mappings, one line per push: "set" or
// "clear", uid, persona id, item type, identifier, path, separated by tabs, the last two
// percent-encoded (space, %, control characters). At start it is read and compacted. A push that
// changes nothing writes nothing. Of each mapping only a hash is kept in memory.
//
// All operations may be called from any thread.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "Platform/fs/FileSystem.h"
#include "Platform/os/AuditToken.h"

namespace platform {

struct SandboxMappingKey {
  uid_t uid;
  int32_t personaID;
  uint32_t itemType;
  std::string_view identifier;
};

class Sandbox {
 public:
  explicit Sandbox(const FileSystem& files);
  ~Sandbox();

  // Sets the path of a mapping, or clears it when there is none. Returns 0, else an errno.
  int setContainerPath(const SandboxMappingKey& key, const std::optional<std::string>& path);

  // While one lives, what its thread pushes is collected, and its end writes it with one write,
  // leaving out what cancels itself. For scans that push thousands. Ends on the thread that began
  // it; one inside another writes its own.
  class Batch {
   public:
    explicit Batch(Sandbox& sandbox);
    ~Batch();
    Batch(const Batch&) = delete;
    Batch& operator=(const Batch&) = delete;

    struct Pending;

   private:
    Sandbox& sandbox_;
    std::unique_ptr<Pending> pending_;
  };

  // A token "class;pid;path;hex": an authenticator over class, audit token and path under a key
  // made at each boot.
  Result<std::string> issueFileExtension(const std::string& extensionClass, const std::string& path,
                                         const AuditToken& process) const;
  bool verifyExtension(const std::string& token, const AuditToken& process) const;

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace platform

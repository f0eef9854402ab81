// A device of its own for one test: a fresh root, prepared by tessary-platform, with the real
// daemon running on it and real processes asking it.
//
// Everything runs as root. The root goes when the device goes, with what is mounted below it.
#pragma once

#include <sys/types.h>

#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

#include "Client/Client.h"
#include "Platform/fs/FileSystem.h"
#include "Platform/values/Value.h"

// Who asks. The entitlement names are whole.
struct Caller {
  std::string identifier = "com.example.app";
  platform::Value::Dictionary entitlements;
  bool sandboxed = false;
  std::optional<std::string> persona;
  uid_t uid = 501;

  // Holding "com.veltra.private.Tessary.NAME" = true.
  Caller with(const std::string& name, platform::Value value = true) const;
};

// What a call comes to, as the daemon says it: 1 for success.
template <typename T>
uint64_t codeOf(const tessary::Result<T>& result) {
  return result ? uint64_t{1} : result.error().code;
}

// The content of a file; empty for what is no file.
std::string contentOf(const std::string& path);

// What tessaryctl answered: its JSON, or the daemon's code.
struct Answer {
  uint64_t code = 0;  // 1 for success; 0 when the daemon could not be asked
  nlohmann::json json;
  std::string errors;

  // The path, UUID and so on of an answer to create or lookup; empty without one.
  std::string text(const char* key) const;
};

class Device {
 public:
  // Makes and prepares the root, below `parent` (a directory) when given, with one more user
  // ("NAME:UID") when given. Starts nothing.
  explicit Device(const std::string& parent = {}, const std::string& user = {});
  ~Device();
  Device(const Device&) = delete;
  Device& operator=(const Device&) = delete;

  const std::string& root() const { return root_; }
  // `path` ("/private/var/...") below the root.
  std::string path(const std::string& path) const { return root_ + path; }

  // Starts the daemon and waits until it answers. The test fails when it does not.
  void start();
  // Ends it with SIGTERM; returns its exit status.
  int stop();
  // Ends it with SIGKILL.
  void kill();
  // Lets go of the root, so that the file system that it is on can be unmounted, and takes hold of
  // it again. Between the two nothing but kill() may be called.
  void releaseRoot() { files_.reset(); }
  void reopenRoot();
  pid_t daemonPid() const { return daemon_; }
  // What the daemon wrote to standard error, and its own log.
  std::string systemLog() const;
  std::string daemonLog() const;

  // Runs `tessary-platform ... run` of tessaryctl with these arguments (without --root and --json).
  Answer ask(const Caller& caller, const std::vector<std::string>& arguments) const;
  // Shorthands for the subcommands; an empty identifier stands for the caller's own.
  Answer create(const Caller& caller, const std::string& identifier,
                uint64_t containerClass) const {
    return askFor("create", caller, identifier, containerClass);
  }
  Answer lookup(const Caller& caller, const std::string& identifier,
                uint64_t containerClass) const {
    return askFor("lookup", caller, identifier, containerClass);
  }

  // A connection of the test's own process, which gets a record with this caller's identifier and
  // entitlements; its uid is root's. The daemon has accepted it: the next call rewrites the record,
  // and open connections keep what they were accepted with.
  tessary::Client connect(const Caller& caller) const;

  // Writes etc/tessary/personas.plist whole, atomically.
  struct Persona {
    std::string uniqueString;
    uint32_t personaID;
    std::string kind;
    std::string layoutPath;  // below the root; empty for none
    std::vector<std::string> bundleIdentifiers;
  };
  void setPersonas(const std::vector<Persona>& personas) const;

  // The files under the root, reached as the daemon reaches them.
  const platform::FileSystem& files() const { return *files_; }

  static std::string program(const std::string& name);

 private:
  Answer askFor(const char* command, const Caller& caller, const std::string& identifier,
                uint64_t containerClass) const;

  std::string root_;
  std::unique_ptr<platform::FileSystem> files_;
  pid_t daemon_ = -1;
};

// Everything allowed; the identifier of an installer that is not the remembered one.
Caller privilegedCaller();

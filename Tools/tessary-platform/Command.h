// The groups of subcommands of tessary-platform. Each adds its own to the application and leaves
// the work for later: `chosen` runs after the command line has been read, and answers the exit
// status: 0, 1 when it could not be done, 2 for bad usage.
#pragma once

#include <fmt/format.h>
#include <sys/types.h>

#include <CLI/CLI.hpp>
#include <functional>
#include <memory>
#include <string>

#include "Platform/fs/FileSystem.h"

struct Application {
  CLI::App cli{"Prepares and drives what stands in for the operating system under a root."};
  std::string root = "/";
  std::function<int()> chosen;
};

void addInitCommand(Application& application);
void addRunCommand(Application& application);
void addLockCommands(Application& application);
void addShowCommand(Application& application);
void addPersonaCommands(Application& application);

// The user "mobile" of a device, and of its personal persona.
inline constexpr uid_t kMobileUID = 501;

inline constexpr int kDone = 0;
inline constexpr int kFailed = 1;
inline constexpr int kBadUsage = 2;

// Prints "tessary-platform: TEXT" and answers `status`.
int complain(int status, const std::string& text);

// The files under the root, for a command that only looks; none, with a complaint, when it cannot
// be opened.
std::unique_ptr<platform::FileSystem> openRoot(const Application& application);
// The same for a command that writes under run/tessary, which is prepared.
std::unique_ptr<platform::FileSystem> openPreparedRoot(const Application& application);

// The daemon's two logs.
//
// TSYLogWrite goes to the rotating file "tessaryd.log": level 3 error, 5 notice, 7 debug; what is
// above the threshold is not formatted. While no log is open every message is handed to the system
// log instead. TSYSystemLogWrite goes to the system log, on the channel of one category.
//
// All functions may be called from any thread, and under any lock: they take no other.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Daemon/TSYError.h"
#include "Platform/os/SystemLog.h"

inline constexpr int TSYLogLevelError = 3;
inline constexpr int TSYLogLevelNotice = 5;
inline constexpr int TSYLogLevelDebug = 7;

struct TSYLogRotation {
  unsigned files;
  size_t bytesPerFile;
};

// Opens the daemon log. Called once at start-up, before any other thread runs; false when the file
// cannot be opened, and then there is no log.
bool TSYLogOpen(const std::string& path, int32_t threshold, TSYLogRotation rotation);
// Whether a message of this level is handed to a log.
bool TSYLogIsEnabled(int level);
void TSYLogWriteText(int level, std::string_view functionName, std::string_view text);

template <typename... Arguments>
void TSYLogWrite(int level, TSYLocatedFormat<std::type_identity_t<Arguments>...> format,
                 Arguments&&... arguments) {
  if (!TSYLogIsEnabled(level)) return;
  TSYLogWriteText(level, TSYFunctionName(format.location),
                  fmt::format(format.format, std::forward<Arguments>(arguments)...));
}

// The categories of the subsystem "com.veltra.tessary"; `daemon` is the one of
// "com.veltra.tessaryd".
enum class TSYChannel {
  unspecified,
  cache,
  sandbox,
  relay,
  locking,
  database,
  upcall,
  lifecycle,
  fs,
  startup,
  test,
  metadata,
  codesignmapping,
  daemon,
};

void TSYSystemLogWriteText(TSYChannel channel, platform::LogLevel level,
                           std::string_view functionName, std::string_view text);
bool TSYSystemLogIsEnabled(platform::LogLevel level);

template <typename... Arguments>
void TSYSystemLogWrite(TSYChannel channel, platform::LogLevel level,
                       TSYLocatedFormat<std::type_identity_t<Arguments>...> format,
                       Arguments&&... arguments) {
  if (!TSYSystemLogIsEnabled(level)) return;
  TSYSystemLogWriteText(channel, level, TSYFunctionName(format.location),
                        fmt::format(format.format, std::forward<Arguments>(arguments)...));
}

// A list as messages show it: "(a, b)", or "(null)" without one.
std::string TSYListText(const std::optional<std::vector<std::string>>& list);

// From now on an exception that nobody catches leaves its text in the log and ends the process.
void TSYInstallUncaughtExceptionHandler();

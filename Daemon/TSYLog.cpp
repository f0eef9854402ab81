// The daemon log is a rotating file of spdlog's; the system log is the platform's. Neither takes a
// lock of the daemon's, so both may be written from anywhere.
#include "Daemon/TSYLog.h"

#include <cxxabi.h>
#include <execinfo.h>
#include <pthread.h>
#include <spdlog/logger.h>
#include <spdlog/sinks/rotating_file_sink.h>
#include <sys/stat.h>

#include <array>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <memory>

#include "Daemon/TSYTypeName.h"
#include "Platform/base/Mutex.h"

namespace {

constexpr mode_t kLogFileMode = 0644;

struct DaemonLog {
  int32_t threshold;
  spdlog::logger logger;
};

// Set once, at start-up; never replaced and never destroyed.
std::atomic<DaemonLog*> openLog = nullptr;

const platform::SystemLog& systemLog() {
  static const platform::SystemLog log;
  return log;
}

spdlog::level::level_enum spdlogLevel(int level) {
  if (level <= TSYLogLevelError) return spdlog::level::err;
  return level <= TSYLogLevelNotice ? spdlog::level::info : spdlog::level::debug;
}

platform::LogLevel systemLogLevel(int level) {
  if (level <= TSYLogLevelError) return platform::LogLevel::error;
  return level <= TSYLogLevelNotice ? platform::LogLevel::standard : platform::LogLevel::debug;
}

std::string_view categoryName(TSYChannel channel) {
  constexpr std::array<std::string_view, 14> kNames = {
      "unspecified", "cache", "sandbox", "relay", "locking",  "database",        "upcall",
      "lifecycle",   "fs",    "startup", "test",  "metadata", "codesignmapping", "daemon"};
  return kNames.at(static_cast<size_t>(channel));
}

// One message is one line, whatever a client put into it.
std::string onOneLine(std::string_view text) {
  std::string line;
  line.reserve(text.size());
  for (const char c : text) {
    if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) {
      fmt::format_to(std::back_inserter(line), "\\x{:02x}", static_cast<unsigned char>(c));
    } else {
      line += c;
    }
  }
  return line;
}

std::string callStack() {
  constexpr int kDeepest = 64;
  std::array<void*, kDeepest> frames{};
  const int count = ::backtrace(frames.data(), kDeepest);
  const std::unique_ptr<char*, decltype(&std::free)> symbols(
      ::backtrace_symbols(frames.data(), count), &std::free);
  std::string text;
  for (int i = 0; symbols && i < count; ++i) {
    if (i > 0) text += '\n';
    text += symbols.get()[i];
  }
  return text;
}

std::string nameOfCallingThread() {
  std::array<char, 16> name{};
  ::pthread_getname_np(::pthread_self(), name.data(), name.size());
  return name.data();
}

std::string uncaughtExceptionText() {
  std::string text = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
  if (const std::string thread = nameOfCallingThread(); !thread.empty()) {
    text += "<" + thread + "> ";
  }
  if (const std::type_info* type = abi::__cxa_current_exception_type()) {
    text += TSYTypeName(*type) + ": ";
  }
  if (const std::exception_ptr exception = std::current_exception()) {
    try {
      std::rethrow_exception(exception);
    } catch (const std::exception& reason) {
      text += reason.what();
    } catch (...) {
      text += "(no reason)";
    }
  }
  return text + "\nStack:\n" + callStack();
}

platform::Mutex crashReportMutex;
// Kept on the heap for whoever looks at the core.
const std::string* crashReportMessage GUARDED_BY(crashReportMutex) = nullptr;

[[noreturn]] void reportUncaughtExceptionAndAbort() {
  const platform::MutexLock lock(crashReportMutex);
  crashReportMessage = new std::string(uncaughtExceptionText());
  TSYSystemLogWriteText(TSYChannel::unspecified, platform::LogLevel::fault, "terminate",
                        *crashReportMessage);
  std::abort();
}

}  // namespace

bool TSYLogOpen(const std::string& path, int32_t threshold, TSYLogRotation rotation) {
  try {
    // The daemon's umask is 0: each file is given its mode when it is opened.
    spdlog::file_event_handlers handlers;
    handlers.after_open = [](const spdlog::filename_t&, std::FILE* file) {
      (void)::fchmod(::fileno(file), kLogFileMode);
    };
    auto sink = std::make_shared<spdlog::sinks::rotating_file_sink_mt>(
        path, rotation.bytesPerFile, rotation.files - 1, /*rotate_on_open=*/false, handlers);
    sink->set_pattern("%Y-%m-%d %H:%M:%S.%e %P %t %L %v");
    auto log = std::make_unique<DaemonLog>(threshold, spdlog::logger("com.veltra.tessaryd", sink));
    log->logger.set_level(spdlog::level::trace);
    log->logger.flush_on(spdlog::level::trace);
    openLog = log.release();
    return true;
  } catch (const spdlog::spdlog_ex&) {
    return false;
  }
}

bool TSYLogIsEnabled(int level) {
  const DaemonLog* log = openLog;
  return log == nullptr || level <= log->threshold;
}

void TSYLogWriteText(int level, std::string_view functionName, std::string_view text) {
  if (DaemonLog* log = openLog) {
    log->logger.log(spdlogLevel(level), "{}: {}", functionName, onOneLine(text));
  } else if (systemLog().enabled(systemLogLevel(level))) {
    systemLog().write(systemLogLevel(level), "daemon", functionName, 0, text);
  }
}

bool TSYSystemLogIsEnabled(platform::LogLevel level) {
  return systemLog().enabled(level);
}

void TSYSystemLogWriteText(TSYChannel channel, platform::LogLevel level,
                           std::string_view functionName, std::string_view text) {
  systemLog().write(level, categoryName(channel), functionName, 0, text);
}

std::string TSYListText(const std::optional<std::vector<std::string>>& list) {
  return list ? fmt::format("({})", fmt::join(*list, ", ")) : "(null)";
}

void TSYInstallUncaughtExceptionHandler() {
  std::set_terminate(reportUncaughtExceptionAndAbort);
}

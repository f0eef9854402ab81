// One message is one line and one system call: sendmsg(2) to the journal, or write(2) to standard
// error, whose lines therefore do not mix.
#define SD_JOURNAL_SUPPRESS_LOCATION
#include "Platform/os/SystemLog.h"

#include <fmt/format.h>
#include <sys/uio.h>
#include <syslog.h>
#include <systemd/sd-journal.h>
#include <time.h>
#include <unistd.h>

#include <array>
#include <cstdlib>

namespace platform {
namespace {

constexpr char kJournalSocket[] = "/run/systemd/journal/socket";

struct LevelName {
  LogLevel level;
  std::string_view name;
  int priority;
};

constexpr std::array<LevelName, 5> kLevels{{
    {LogLevel::debug, "debug", LOG_DEBUG},
    {LogLevel::info, "info", LOG_INFO},
    {LogLevel::standard, "default", LOG_NOTICE},
    {LogLevel::error, "error", LOG_ERR},
    {LogLevel::fault, "fault", LOG_CRIT},
}};

const LevelName& nameOf(LogLevel level) {
  return kLevels[static_cast<size_t>(level)];
}

LogLevel thresholdFromEnvironment() {
  const char* const wanted = ::getenv("TESSARY_LOG_LEVEL");
  for (const LevelName& level : kLevels) {
    if (wanted != nullptr && level.name == wanted) return level.level;
  }
  return LogLevel::standard;
}

// C0 and DEL are one byte; the C1 control characters, which terminals obey too, are 0xC2 and a
// second byte in UTF-8.
bool isControl(std::string_view text, size_t i) {
  const auto byte = static_cast<unsigned char>(text[i]);
  if (byte < 0x20 || byte == 0x7F) return true;
  if (byte < 0x80 || byte > 0x9F || i == 0) return false;
  return static_cast<unsigned char>(text[i - 1]) == 0xC2;
}

void appendEscaped(fmt::memory_buffer& buffer, std::string_view text) {
  for (size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (!isControl(text, i)) {
      buffer.push_back(c);
    } else if (c == '\n') {
      fmt::format_to(fmt::appender(buffer), "\\n");
    } else {
      fmt::format_to(fmt::appender(buffer), "\\x{:02x}", static_cast<unsigned char>(c));
    }
  }
}

void appendTime(fmt::memory_buffer& buffer) {
  timespec now{};
  ::clock_gettime(CLOCK_REALTIME, &now);
  tm parts{};
  ::gmtime_r(&now.tv_sec, &parts);
  fmt::format_to(fmt::appender(buffer), "{:04}-{:02}-{:02}T{:02}:{:02}:{:02}.{:06}Z",
                 parts.tm_year + 1900, parts.tm_mon + 1, parts.tm_mday, parts.tm_hour, parts.tm_min,
                 parts.tm_sec, now.tv_nsec / 1000);
}

void writeToStandardError(LogLevel level, std::string_view category, std::string_view function,
                          uint64_t code, std::string_view text) {
  fmt::memory_buffer line;
  appendTime(line);
  fmt::format_to(fmt::appender(line), " {} {} {}: ", nameOf(level).name, category, function);
  appendEscaped(line, text);
  if (code != 0) fmt::format_to(fmt::appender(line), " (code {})", code);
  line.push_back('\n');
  // A log that nobody can read any more is not worth a failure.
  [[maybe_unused]] const ssize_t count = ::write(STDERR_FILENO, line.data(), line.size());
}

void writeToJournal(LogLevel level, std::string_view category, std::string_view function,
                    uint64_t code, std::string_view text) {
  // The fields one after the other in one buffer, each ended where the next begins.
  fmt::memory_buffer buffer;
  std::array<size_t, 6> ends{};
  size_t count = 0;
  const auto endField = [&] { ends[count++] = buffer.size(); };
  fmt::format_to(fmt::appender(buffer), "MESSAGE=");
  appendEscaped(buffer, text);
  endField();
  fmt::format_to(fmt::appender(buffer), "PRIORITY={}", nameOf(level).priority);
  endField();
  fmt::format_to(fmt::appender(buffer), "TESSARY_CATEGORY={}", category);
  endField();
  fmt::format_to(fmt::appender(buffer), "TESSARY_FUNCTION={}", function);
  endField();
  if (code != 0) {
    fmt::format_to(fmt::appender(buffer), "TESSARY_CODE={}", code);
    endField();
  }
  std::array<iovec, 6> fields{};
  size_t begin = 0;
  for (size_t i = 0; i < count; ++i) {
    fields[i] = {buffer.data() + begin, ends[i] - begin};
    begin = ends[i];
  }
  ::sd_journal_sendv(fields.data(), static_cast<int>(count));
}

}  // namespace

SystemLog::SystemLog()
    : SystemLog(thresholdFromEnvironment(), ::access(kJournalSocket, W_OK) == 0) {}

SystemLog::SystemLog(LogLevel threshold, bool journal)
    : threshold_(threshold), hasJournal_(journal) {}

void SystemLog::write(LogLevel level, std::string_view category, std::string_view function,
                      uint64_t code, std::string_view text) const {
  if (!enabled(level)) return;
  if (hasJournal_) {
    writeToJournal(level, category, function, code, text);
  } else {
    writeToStandardError(level, category, function, code, text);
  }
}

}  // namespace platform

// The system log: journald, or standard error when there is no journal.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace platform {

enum class LogLevel { debug, info, standard, error, fault };

class SystemLog {
 public:
  // Reads TESSARY_LOG_LEVEL (debug, info, default, error, fault): what is below is dropped.
  // "default" when it is not set.
  SystemLog();
  // With a threshold of its own, to the journal or to standard error.
  SystemLog(LogLevel threshold, bool journal);

  // Whether a message of this level goes anywhere: ask before formatting. Any thread.
  bool enabled(LogLevel level) const { return level >= threshold_; }
  // Fields TESSARY_CATEGORY, TESSARY_FUNCTION and, when it is not 0, TESSARY_CODE. Control
  // characters in the text are shown as escapes: one message is one line. Any thread.
  void write(LogLevel level, std::string_view category, std::string_view function, uint64_t code,
             std::string_view text) const;

 private:
  LogLevel threshold_;
  bool hasJournal_;
};

}  // namespace platform

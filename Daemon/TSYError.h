// Failures: what every operation that can fail returns instead of its result.
//
// A TSYError is a small handle on one immutable object, cheap to copy and free to share between
// threads. Its domain is "TSYErrorDomain", with a TSYErrorCode, or the POSIX domain, with an errno.
#pragma once

#include <fmt/format.h>

#include <cstdint>
#include <expected>
#include <memory>
#include <optional>
#include <source_location>
#include <string>
#include <string_view>

#include "Daemon/TSYErrorCode.h"
#include "Platform/base/Errno.h"

inline constexpr std::string_view TSYErrorDomain = "TSYErrorDomain";
inline constexpr std::string_view TSYPosixErrorDomain = "POSIX";

class TSYError {
 public:
  struct Details;
  explicit TSYError(Details details);

  // A failure that carries no detail: code 1 of the TSYErrorDomain.
  static TSYError withoutDetail(std::source_location where = std::source_location::current());

  std::string_view domain() const;
  uint64_t code() const;
  // The code as a client gets it: a POSIX error that nobody has named is a failed file operation.
  uint64_t clientCode() const;
  bool isPosix(int errnoValue) const;
  bool is(TSYErrorCode code) const;
  // None when the error was built without a format.
  const std::optional<std::string>& localizedDescription() const;
  const std::optional<TSYError>& underlying() const;
  // "[Class operation]" for a method, the plain name for a function.
  const std::string& functionName() const;
  uint32_t sourceFileLine() const;

  // One line of text with everything but the source position, for messages.
  std::string description() const;

 private:
  std::shared_ptr<const Details> details_;
};

struct TSYError::Details {
  std::string_view domain;
  uint64_t code;
  std::optional<std::string> description;
  std::optional<TSYError> underlying;
  std::string functionName;
  uint32_t sourceFileLine;
};

// The result of an operation that can fail. "Left untouched on success" needs no code, and nobody
// can forget to look.
template <typename T>
class [[nodiscard]] TSYResult : public std::expected<T, TSYError> {
 public:
  using std::expected<T, TSYError>::expected;
};

inline std::unexpected<TSYError> TSYFailure(TSYError error) {
  return std::unexpected<TSYError>(std::move(error));
}

// A format string that knows where it was written.
template <typename... Arguments>
struct TSYLocatedFormat {
  template <typename Text>
  consteval TSYLocatedFormat(const Text& text,
                             std::source_location where = std::source_location::current())
      : format(text), location(where) {}

  fmt::format_string<Arguments...> format;
  std::source_location location;
};

enum class TSYLogIt : bool { no, yes };

// "[Class operation]" or the plain function name.
std::string TSYFunctionName(const std::source_location& location);

TSYError TSYErrorCreateWithText(uint64_t code, std::optional<TSYError> underlying, TSYLogIt logIt,
                                std::source_location where, std::optional<std::string> text);

// Builds a failure of the TSYErrorDomain and, with TSYLogIt::yes, logs it at level 3 together with
// the underlying one.
template <typename... Arguments>
TSYError TSYErrorCreate(uint64_t code, std::optional<TSYError> underlying, TSYLogIt logIt,
                        TSYLocatedFormat<std::type_identity_t<Arguments>...> format,
                        Arguments&&... arguments) {
  return TSYErrorCreateWithText(code, std::move(underlying), logIt, format.location,
                                fmt::format(format.format, std::forward<Arguments>(arguments)...));
}
// The same without a format: no description, and nothing is logged.
TSYError TSYErrorCreate(uint64_t code, std::optional<TSYError> underlying, TSYLogIt logIt,
                        std::source_location where = std::source_location::current());

TSYError TSYPosixErrorCreateWithText(int errnoValue, std::source_location where, std::string text);

// Builds a failure of the POSIX domain. Nothing is logged.
template <typename... Arguments>
TSYError TSYPosixErrorCreate(platform::Errno error,
                             TSYLocatedFormat<std::type_identity_t<Arguments>...> format,
                             Arguments&&... arguments) {
  return TSYPosixErrorCreateWithText(
      error.value, format.location,
      fmt::format(format.format, std::forward<Arguments>(arguments)...));
}

template <>
struct fmt::formatter<TSYError> : fmt::formatter<std::string> {
  auto format(const TSYError& error, format_context& context) const {
    return fmt::formatter<std::string>::format(error.description(), context);
  }
};

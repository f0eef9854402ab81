#include "Daemon/TSYError.h"

#include "Daemon/TSYLog.h"

namespace {

// The name in a function's signature: what stands between the return type and the arguments. Both
// the return type and template arguments, which are left out, may hold spaces and names of their
// own; some compilers write a pointer's star right before the name.
std::string qualifiedName(std::string_view signature) {
  std::string name;
  int depth = 0;
  for (const char c : signature) {
    if (c == '<') ++depth;
    if (depth == 0) {
      if (c == '(') break;
      if (c == ' ' || c == '*' || c == '&') {
        name.clear();
      } else {
        name += c;
      }
    }
    if (c == '>') --depth;
  }
  return name;
}

}  // namespace

TSYError::TSYError(Details details)
    : details_(std::make_shared<const Details>(std::move(details))) {}

TSYError TSYError::withoutDetail(std::source_location where) {
  return TSYErrorCreate(TSYErrorSuccess, std::nullopt, TSYLogIt::no, where);
}

std::string_view TSYError::domain() const {
  return details_->domain;
}
uint64_t TSYError::code() const {
  return details_->code;
}
const std::string& TSYError::functionName() const {
  return details_->functionName;
}
uint32_t TSYError::sourceFileLine() const {
  return details_->sourceFileLine;
}
const std::optional<TSYError>& TSYError::underlying() const {
  return details_->underlying;
}
const std::optional<std::string>& TSYError::localizedDescription() const {
  return details_->description;
}

uint64_t TSYError::clientCode() const {
  return domain() == TSYErrorDomain ? code() : uint64_t{TSYErrorFileOperationFailed};
}

bool TSYError::isPosix(int errnoValue) const {
  return domain() == TSYPosixErrorDomain && code() == static_cast<uint64_t>(errnoValue);
}

bool TSYError::is(TSYErrorCode code) const {
  return domain() == TSYErrorDomain && details_->code == code;
}

std::string TSYError::description() const {
  std::string text = fmt::format("{}:{}", domain(), code());
  if (localizedDescription()) text += fmt::format(" \"{}\"", *localizedDescription());
  if (underlying()) text += fmt::format(" ({})", *underlying());
  return text;
}

std::string TSYFunctionName(const std::source_location& location) {
  std::string name = location.function_name();
  // Clang's and GCC's names of the unnamed namespace.
  for (const std::string_view anonymous : {"(anonymous namespace)::", "{anonymous}::"}) {
    for (size_t at = name.find(anonymous); at != std::string::npos; at = name.find(anonymous)) {
      name.erase(at, anonymous.size());
    }
  }
  name = qualifiedName(name);
  const size_t operation = name.rfind("::");
  if (operation == std::string::npos) return name;
  const size_t outer = operation == 0 ? std::string::npos : name.rfind("::", operation - 1);
  const size_t start = outer == std::string::npos ? 0 : outer + 2;
  return fmt::format("[{} {}]", std::string_view(name).substr(start, operation - start),
                     std::string_view(name).substr(operation + 2));
}

TSYError TSYErrorCreateWithText(uint64_t code, std::optional<TSYError> underlying, TSYLogIt logIt,
                                std::source_location where, std::optional<std::string> text) {
  const std::string functionName = TSYFunctionName(where);
  if (text && logIt == TSYLogIt::yes && TSYLogIsEnabled(TSYLogLevelError)) {
    const std::string line = underlying
                                 ? fmt::format("{}: {} ({})", where.line(), *text, *underlying)
                                 : fmt::format("{}: {}", where.line(), *text);
    TSYLogWriteText(TSYLogLevelError, functionName, line);
  }
  return TSYError({.domain = TSYErrorDomain,
                   .code = code,
                   .description = std::move(text),
                   .underlying = std::move(underlying),
                   .functionName = functionName,
                   .sourceFileLine = where.line()});
}

TSYError TSYErrorCreate(uint64_t code, std::optional<TSYError> underlying, TSYLogIt logIt,
                        std::source_location where) {
  return TSYErrorCreateWithText(code, std::move(underlying), logIt, where, std::nullopt);
}

TSYError TSYPosixErrorCreateWithText(int errnoValue, std::source_location where, std::string text) {
  return TSYError({.domain = TSYPosixErrorDomain,
                   .code = static_cast<uint64_t>(errnoValue),
                   .description = std::move(text),
                   .underlying = std::nullopt,
                   .functionName = TSYFunctionName(where),
                   .sourceFileLine = where.line()});
}

#include "Daemon/TSYInvariant.h"

#include <cstdlib>

#include "Daemon/TSYLog.h"

void TSYInvariantBroken(std::string_view invariant, std::source_location where) {
  const std::string text = fmt::format("Assertion failed at line {}: {}", where.line(), invariant);
  TSYSystemLogWriteText(TSYChannel::unspecified, platform::LogLevel::fault, TSYFunctionName(where),
                        text);
  std::abort();
}

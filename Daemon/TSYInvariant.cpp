#include "Daemon/TSYInvariant.h"

#include <cstdlib>

void TSYStopProcess(TSYChannel channel, std::string_view reason, std::source_location where) {
  TSYSystemLogWriteText(channel, platform::LogLevel::fault, TSYFunctionName(where), reason);
  std::_Exit(EXIT_FAILURE);
}

void TSYInvariantBroken(std::string_view invariant, std::source_location where) {
  const std::string text = fmt::format("Assertion failed at line {}: {}", where.line(), invariant);
  TSYSystemLogWriteText(TSYChannel::unspecified, platform::LogLevel::fault, TSYFunctionName(where),
                        text);
  std::abort();
}

// Invariants that well-paired calls cannot break. A broken one stops the process, naming itself.
#pragma once

#include <source_location>
#include <string_view>

[[noreturn]] void TSYInvariantBroken(std::string_view invariant, std::source_location where);

#define TSY_INVARIANT(condition)          \
  (static_cast<bool>(condition) ? void(0) \
                                : TSYInvariantBroken(#condition, std::source_location::current()))

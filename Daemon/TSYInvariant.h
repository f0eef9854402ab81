// The ends of the process: a broken invariant, which well-paired calls cannot break, and the lack
// of what the daemon cannot do without.
#pragma once

#include <source_location>
#include <string_view>

#include "Daemon/TSYLog.h"

// Ends the process with a fault in the system log; the service manager sees it fail.
[[noreturn]] void TSYStopProcess(TSYChannel channel, std::string_view reason,
                                 std::source_location where = std::source_location::current());

[[noreturn]] void TSYInvariantBroken(std::string_view invariant, std::source_location where);

#define TSY_INVARIANT(condition)          \
  (static_cast<bool>(condition) ? void(0) \
                                : TSYInvariantBroken(#condition, std::source_location::current()))

// The stand-ins' own lines in the system log, under the category "platform". Any thread, any lock.
#pragma once

#include <fmt/format.h>

#include <string_view>

#include "Platform/os/SystemLog.h"

namespace platform {

void platformLogText(LogLevel level, std::string_view function, std::string_view text);
bool platformLogIsEnabled(LogLevel level);

template <typename... Arguments>
void platformLog(LogLevel level, std::string_view function, fmt::format_string<Arguments...> format,
                 Arguments&&... arguments) {
  if (!platformLogIsEnabled(level)) return;
  platformLogText(level, function, fmt::format(format, std::forward<Arguments>(arguments)...));
}

}  // namespace platform

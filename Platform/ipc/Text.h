// What may travel as text.
#pragma once

#include <string_view>

#include "Platform/values/Unicode.h"

namespace platform::ipc {

// Well-formed UTF-8 without a NUL, so that every string of a message is also a C string.
inline bool isValidText(std::string_view text) {
  return text.find('\0') == std::string_view::npos && isUTF8(text);
}

}  // namespace platform::ipc

// Numbers from text. Any thread.
#pragma once

#include <charconv>
#include <optional>
#include <string_view>
#include <system_error>

namespace platform {

// The whole of `text` as a number; none when it is anything else or does not fit. There is no white
// space and no sign but the minus of a signed type. `format` is what std::from_chars takes: a base,
// or a std::chars_format.
template <typename Number, typename... Format>
std::optional<Number> wholeNumber(std::string_view text, Format... format) {
  Number number{};
  const char* const end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, number, format...);
  if (error != std::errc() || stop != end) return std::nullopt;
  return number;
}

}  // namespace platform

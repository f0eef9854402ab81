// UTF-8, strictly: overlong forms, surrogates and what lies beyond U+10FFFF are not well-formed.
// A NUL is a character like any other.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace platform {

bool isASCII(std::string_view text);
bool isUTF8(std::string_view text);

// Removes the first character of a non-empty text and returns it; nothing when what stands there
// is not well-formed.
std::optional<char32_t> takeCharacter(std::string_view& text);

// `character` must be a Unicode scalar value: at most U+10FFFF and no surrogate.
void appendCharacter(std::string& text, char32_t character);

}  // namespace platform

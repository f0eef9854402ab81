#include "Platform/values/Unicode.h"

#include <cstddef>
#include <cstdint>

namespace platform {
namespace {

// How a multi-byte character begins: its length, the payload bits of the lead byte, and the least
// character that needs the length (a smaller one is an overlong form).
struct Lead {
  size_t length;
  char32_t bits;
  char32_t least;
};

std::optional<Lead> leadOf(uint8_t byte) {
  if ((byte & 0xE0) == 0xC0) return Lead{2, byte & 0x1FU, 0x80};
  if ((byte & 0xF0) == 0xE0) return Lead{3, byte & 0x0FU, 0x800};
  if ((byte & 0xF8) == 0xF0) return Lead{4, byte & 0x07U, 0x10000};
  return std::nullopt;
}

}  // namespace

bool isASCII(std::string_view text) {
  unsigned bits = 0;
  for (const char character : text) bits |= static_cast<uint8_t>(character);
  return bits < 0x80;
}

bool isUTF8(std::string_view text) {
  if (isASCII(text)) return true;
  while (!text.empty()) {
    if (!takeCharacter(text)) return false;
  }
  return true;
}

std::optional<char32_t> takeCharacter(std::string_view& text) {
  const auto first = static_cast<uint8_t>(text.front());
  if (first < 0x80) {
    text.remove_prefix(1);
    return first;
  }
  const std::optional<Lead> lead = leadOf(first);
  if (!lead || text.size() < lead->length) return std::nullopt;
  char32_t character = lead->bits;
  for (size_t index = 1; index < lead->length; ++index) {
    const auto byte = static_cast<uint8_t>(text[index]);
    if ((byte & 0xC0) != 0x80) return std::nullopt;
    character = character << 6 | (byte & 0x3FU);
  }
  const bool surrogate = character >= 0xD800 && character <= 0xDFFF;
  if (character < lead->least || surrogate || character > 0x10FFFF) return std::nullopt;
  text.remove_prefix(lead->length);
  return character;
}

void appendCharacter(std::string& text, char32_t character) {
  const auto continuation = [&](unsigned shift) {
    text.push_back(static_cast<char>(0x80 | (character >> shift & 0x3F)));
  };
  if (character < 0x80) {
    text.push_back(static_cast<char>(character));
  } else if (character < 0x800) {
    text.push_back(static_cast<char>(0xC0 | character >> 6));
    continuation(0);
  } else if (character < 0x10000) {
    text.push_back(static_cast<char>(0xE0 | character >> 12));
    continuation(6);
    continuation(0);
  } else {
    text.push_back(static_cast<char>(0xF0 | character >> 18));
    continuation(12);
    continuation(6);
    continuation(0);
  }
}

}  // namespace platform

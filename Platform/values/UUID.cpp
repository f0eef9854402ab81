#include "Platform/values/UUID.h"

#include <uuid/uuid.h>

namespace platform {
namespace {

constexpr size_t kTextLength = 36;

// Whether a hyphen stands before byte `index` in the text form.
constexpr bool hyphenBefore(size_t index) {
  return index == 4 || index == 6 || index == 8 || index == 10;
}

constexpr std::array<int, 256> makeDigitValues() {
  std::array<int, 256> values{};
  values.fill(-1);
  for (size_t digit = 0; digit < 10; ++digit) values['0' + digit] = static_cast<int>(digit);
  for (size_t digit = 10; digit < 16; ++digit) {
    values['A' + digit - 10] = static_cast<int>(digit);
    values['a' + digit - 10] = static_cast<int>(digit);
  }
  return values;
}

constexpr std::array<int, 256> kDigitValues = makeDigitValues();

}  // namespace

UUID UUID::random() {
  Bytes bytes;
  ::uuid_generate_random(bytes.data());
  return UUID(bytes);
}

std::optional<UUID> UUID::parse(std::string_view text) {
  if (text.size() != kTextLength) return std::nullopt;
  Bytes bytes;
  size_t at = 0;
  for (size_t index = 0; index < bytes.size(); ++index) {
    if (hyphenBefore(index) && text[at++] != '-') return std::nullopt;
    const int high = kDigitValues[static_cast<uint8_t>(text[at++])];
    const int low = kDigitValues[static_cast<uint8_t>(text[at++])];
    if (high < 0 || low < 0) return std::nullopt;
    bytes[index] = static_cast<uint8_t>(high << 4 | low);
  }
  return UUID(bytes);
}

std::string UUID::string() const {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  std::string text(kTextLength, '-');
  size_t at = 0;
  for (size_t index = 0; index < bytes_.size(); ++index) {
    if (hyphenBefore(index)) ++at;
    text[at++] = kDigits[bytes_[index] >> 4];
    text[at++] = kDigits[bytes_[index] & 0xF];
  }
  return text;
}

}  // namespace platform

size_t std::hash<platform::UUID>::operator()(const platform::UUID& uuid) const noexcept {
  const platform::UUID::Bytes& bytes = uuid.bytes();
  return std::hash<std::string_view>()(
      std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
}

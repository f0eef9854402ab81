#include "Platform/values/XMLPropertyListScalars.h"

#include <array>
#include <chrono>
#include <utility>

#include "Platform/base/WholeNumber.h"

namespace platform::xml_property_list {
namespace {

std::string_view trimmed(std::string_view text) {
  const size_t first = text.find_first_not_of(kSpace);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kSpace) - first + 1);
}

constexpr uint8_t kNoDigit = 0xFF;

constexpr std::array<uint8_t, 256> makeBase64Values() {
  constexpr std::string_view kAlphabet =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::array<uint8_t, 256> values{};
  values.fill(kNoDigit);
  for (size_t index = 0; index < kAlphabet.size(); ++index) {
    values[static_cast<uint8_t>(kAlphabet[index])] = static_cast<uint8_t>(index);
  }
  return values;
}

constexpr std::array<uint8_t, 256> kBase64Values = makeBase64Values();

}  // namespace

std::optional<Value> parseInteger(std::string_view text) {
  text = trimmed(text);
  const bool negative = text.starts_with('-');
  if (negative || text.starts_with('+')) text.remove_prefix(1);
  int base = 10;
  if (text.starts_with("0x") || text.starts_with("0X")) {
    base = 16;
    text.remove_prefix(2);
  }
  const std::optional<uint64_t> magnitude = wholeNumber<uint64_t>(text, base);
  if (!magnitude) return std::nullopt;
  constexpr uint64_t kLeastMagnitude = uint64_t{1} << 63;
  if (negative) {
    if (*magnitude > kLeastMagnitude) return std::nullopt;
    return static_cast<int64_t>(0 - *magnitude);
  }
  if (std::in_range<int64_t>(*magnitude)) return static_cast<int64_t>(*magnitude);
  return *magnitude;
}

std::optional<double> parseReal(std::string_view text) {
  text = trimmed(text);
  if (text.starts_with('+') && !text.starts_with("+-")) text.remove_prefix(1);
  return wholeNumber<double>(text);
}

std::optional<Date> parseDate(std::string_view text) {
  using namespace std::chrono;
  text = trimmed(text);
  if (text.size() != 20 || text[4] != '-' || text[7] != '-' || text[10] != 'T' || text[13] != ':' ||
      text[16] != ':' || text[19] != 'Z') {
    return std::nullopt;
  }
  const auto yearNumber = wholeNumber<unsigned>(text.substr(0, 4));
  const auto monthNumber = wholeNumber<unsigned>(text.substr(5, 2));
  const auto dayNumber = wholeNumber<unsigned>(text.substr(8, 2));
  const auto hour = wholeNumber<unsigned>(text.substr(11, 2));
  const auto minute = wholeNumber<unsigned>(text.substr(14, 2));
  const auto second = wholeNumber<unsigned>(text.substr(17, 2));
  if (!yearNumber || !monthNumber || !dayNumber || !hour || !minute || !second) {
    return std::nullopt;
  }
  const year_month_day calendar(year(static_cast<int>(*yearNumber)), month(*monthNumber),
                                day(*dayNumber));
  if (!calendar.ok() || *hour > 23 || *minute > 59 || *second > 59) return std::nullopt;
  const sys_seconds time = sys_days(calendar) + hours(*hour) + minutes(*minute) + seconds(*second);
  return Date{static_cast<double>(time.time_since_epoch().count())};
}

std::optional<Value::Data> parseData(std::string_view text) {
  Value::Data data;
  data.reserve(text.size() / 4 * 3);
  uint32_t bits = 0;  // of the digits of the current group of four
  size_t digitCount = 0;
  size_t padding = 0;
  for (const char character : text) {
    if (kSpace.find(character) != std::string_view::npos) continue;
    if (character == '=') {
      ++padding;
      continue;
    }
    const uint8_t value = kBase64Values[static_cast<uint8_t>(character)];
    if (value == kNoDigit || padding > 0) return std::nullopt;
    bits = bits << 6 | value;
    if (++digitCount % 4 != 0) continue;
    for (const unsigned shift : {16U, 8U, 0U}) data.push_back(static_cast<uint8_t>(bits >> shift));
  }
  const size_t rest = digitCount % 4;
  if (rest == 1 || padding != (4 - rest) % 4) return std::nullopt;
  if (rest == 2) data.push_back(static_cast<uint8_t>(bits >> 4));
  if (rest == 3) {
    data.push_back(static_cast<uint8_t>(bits >> 10));
    data.push_back(static_cast<uint8_t>(bits >> 2));
  }
  return data;
}

}  // namespace platform::xml_property_list

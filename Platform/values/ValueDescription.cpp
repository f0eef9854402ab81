// How values show in logs: one line, whatever they hold. What a description quotes may come from
// anywhere, so control characters are escaped, and building stops as soon as it is long enough: a
// large value costs no more than a small one.
#include <fmt/format.h>

#include <chrono>
#include <cmath>
#include <iterator>

#include "Platform/values/Value.h"

namespace platform {
namespace {

constexpr size_t kLongestDescription = 1000;  // bytes, without the ellipsis

// Dates between the years 1 and 9999 are shown as such.
constexpr double kFirstShownSecond = -62135596800.0;
constexpr double kLastShownSecond = 253402300799.0;

std::string describeDate(Date date) {
  using namespace std::chrono;
  const double since1970 = date.secondsSince1970;
  if (!(since1970 >= kFirstShownSecond && since1970 <= kLastShownSecond)) {
    return fmt::format("{} seconds since 1970", since1970);
  }
  const sys_seconds second{seconds(static_cast<int64_t>(std::floor(since1970)))};
  const sys_days day = floor<days>(second);
  const year_month_day calendar(day);
  const hh_mm_ss time(second - day);
  return fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}Z", static_cast<int>(calendar.year()),
                     static_cast<unsigned>(calendar.month()), static_cast<unsigned>(calendar.day()),
                     time.hours().count(), time.minutes().count(), time.seconds().count());
}

class Describer {
 public:
  std::string describe(const Value& value) {
    std::visit(*this, value.storage());
    if (full()) cut();
    return std::move(text_);
  }

  void operator()(std::monostate) { text_ += "null"; }
  void operator()(bool value) { text_ += value ? "true" : "false"; }
  template <typename Number>
    requires std::is_arithmetic_v<Number>
  void operator()(Number value) {
    fmt::format_to(std::back_inserter(text_), "{}", value);
  }
  void operator()(const UUID& value) { text_ += value.string(); }
  void operator()(Date value) { text_ += describeDate(value); }

  void operator()(const std::string& value) {
    for (const char character : value) {
      if (full()) return;
      const auto byte = static_cast<uint8_t>(character);
      if (byte < 0x20 || byte == 0x7F) {
        fmt::format_to(std::back_inserter(text_), "\\x{:02X}", byte);
      } else {
        text_ += character;
      }
    }
  }

  void operator()(const Value::Data& value) {
    text_ += '<';
    for (const uint8_t byte : value) {
      if (full()) return;
      fmt::format_to(std::back_inserter(text_), "{:02x}", byte);
    }
    text_ += '>';
  }

  void operator()(const Value::Array& value) {
    text_ += '(';
    std::string_view separator;
    for (const Value& element : value) {
      if (full()) return;
      text_ += separator;
      std::visit(*this, element.storage());
      separator = ", ";
    }
    text_ += ')';
  }

  void operator()(const Value::Dictionary& value) {
    text_ += '{';
    std::string_view separator;
    for (const auto& [key, element] : value) {
      if (full()) return;
      text_ += separator;
      (*this)(key);
      text_ += " = ";
      std::visit(*this, element.storage());
      separator = "; ";
    }
    text_ += '}';
  }

 private:
  bool full() const { return text_.size() > kLongestDescription; }

  // Ends the text with an ellipsis, never within a character.
  void cut() {
    size_t end = kLongestDescription;
    while (end > 0 && (static_cast<uint8_t>(text_[end]) & 0xC0) == 0x80) --end;
    text_.resize(end);
    text_ += "…";
  }

  std::string text_;
};

}  // namespace

std::string Value::description() const {
  return Describer().describe(*this);
}

}  // namespace platform

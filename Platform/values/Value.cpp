#include "Platform/values/Value.h"

#include <cmath>
#include <limits>
#include <utility>

namespace platform {
namespace {

// The first double that no uint64_t holds, 2^64.
constexpr double kBeyondUInt64 = 18446744073709551616.0;

uint64_t heldToRange(double number) {
  if (std::isnan(number) || number <= 0) return 0;
  if (number >= kBeyondUInt64) return std::numeric_limits<uint64_t>::max();
  return static_cast<uint64_t>(number);
}

template <typename T>
constexpr bool kIsNumber = std::is_arithmetic_v<T>;

}  // namespace

bool Value::isNumber() const {
  return std::visit([]<typename T>(const T&) { return kIsNumber<T>; }, storage_);
}

std::optional<int64_t> Value::asInt64() const {
  if (const auto* number = std::get_if<int64_t>(&storage_)) return *number;
  const auto* number = std::get_if<uint64_t>(&storage_);
  if (number == nullptr || !std::in_range<int64_t>(*number)) return std::nullopt;
  return static_cast<int64_t>(*number);
}

std::optional<uint64_t> Value::asUInt64() const {
  if (const auto* number = std::get_if<uint64_t>(&storage_)) return *number;
  const auto* number = std::get_if<int64_t>(&storage_);
  if (number == nullptr || *number < 0) return std::nullopt;
  return static_cast<uint64_t>(*number);
}

std::optional<bool> Value::booleanOfNumber() const {
  return std::visit(
      []<typename T>(const T& value) -> std::optional<bool> {
        if constexpr (kIsNumber<T>) return value != T{};
        return std::nullopt;
      },
      storage_);
}

std::optional<uint64_t> Value::unsignedOfNumber() const {
  return std::visit(
      []<typename T>(const T& value) -> std::optional<uint64_t> {
        if constexpr (std::is_same_v<T, double>) return heldToRange(value);
        if constexpr (std::is_integral_v<T>) return static_cast<uint64_t>(value);
        return std::nullopt;
      },
      storage_);
}

const Value* Value::find(std::string_view key) const {
  const Dictionary* dictionary = asDictionary();
  if (dictionary == nullptr) return nullptr;
  const auto found = dictionary->find(key);
  return found == dictionary->end() ? nullptr : &found->second;
}

std::string_view Value::typeName() const {
  // In the order of the alternatives of Storage.
  static constexpr std::string_view kNames[] = {"null", "boolean", "integer",   "integer",
                                                "real", "string",  "data",      "UUID",
                                                "date", "array",   "dictionary"};
  static_assert(std::size(kNames) == std::variant_size_v<Storage>);
  return kNames[storage_.index()];
}

bool Value::operator==(const Value& other) const {
  if (storage_.index() == other.storage_.index()) return storage_ == other.storage_;
  // Two alternatives hold integers: the same integer may stand in either.
  const std::optional<int64_t> integer = asInt64();
  return integer && integer == other.asInt64();
}

}  // namespace platform

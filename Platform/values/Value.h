// The value type of everything structured that crosses a boundary: IPC messages, property lists,
// entitlements.
//
// A Value is a plain value: copying copies it whole, and threads may share a const one. Accessors
// answer nothing for another type, so that a reader of untrusted data asks for what it expects and
// never has to test first.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "Platform/values/UUID.h"

namespace platform {

// A point in time: seconds since 1970-01-01 00:00:00 UTC, fractions included.
struct Date {
  double secondsSince1970 = 0;
  bool operator==(const Date&) const = default;
};

class Value {
 public:
  using Array = std::vector<Value>;
  using Data = std::vector<uint8_t>;
  using Dictionary = std::map<std::string, Value, std::less<>>;

  Value() = default;  // null
  Value(std::nullptr_t) {}
  Value(bool value) : storage_(value) {}
  Value(int64_t value) : storage_(value) {}
  Value(uint64_t value) : storage_(value) {}
  Value(int value) : storage_(static_cast<int64_t>(value)) {}
  Value(uint32_t value) : storage_(static_cast<uint64_t>(value)) {}
  Value(double value) : storage_(value) {}
  Value(const char* value) : storage_(std::string(value)) {}
  Value(std::string_view value) : storage_(std::string(value)) {}
  Value(std::string value) : storage_(std::move(value)) {}
  Value(Data value) : storage_(std::move(value)) {}
  Value(const UUID& value) : storage_(value) {}
  Value(Date value) : storage_(value) {}
  Value(Array value) : storage_(std::move(value)) {}
  Value(Dictionary value) : storage_(std::move(value)) {}

  bool isNull() const { return std::holds_alternative<std::monostate>(storage_); }
  // A bool counts as a number, as it does in property lists.
  bool isNumber() const;

  // Exact types: nothing for any other type of value.
  const bool* asBool() const { return std::get_if<bool>(&storage_); }
  const std::string* asString() const { return std::get_if<std::string>(&storage_); }
  const Data* asData() const { return std::get_if<Data>(&storage_); }
  const UUID* asUUID() const { return std::get_if<UUID>(&storage_); }
  const Date* asDate() const { return std::get_if<Date>(&storage_); }
  const double* asDouble() const { return std::get_if<double>(&storage_); }
  const Array* asArray() const { return std::get_if<Array>(&storage_); }
  const Dictionary* asDictionary() const { return std::get_if<Dictionary>(&storage_); }
  Array* asArray() { return std::get_if<Array>(&storage_); }
  Dictionary* asDictionary() { return std::get_if<Dictionary>(&storage_); }

  // The integers: either signedness answers as long as the number fits.
  std::optional<int64_t> asInt64() const;
  std::optional<uint64_t> asUInt64() const;
  // True and false, and every other number as non-zero or zero; nothing for what is no number.
  std::optional<bool> booleanOfNumber() const;
  // Any number as an unsigned 64-bit integer, converted as C does (a bool as 0 or 1, a negative one
  // modulo 2^64, a floating-point one truncated and held to the range); nothing for no number.
  std::optional<uint64_t> unsignedOfNumber() const;

  // The value under a key when this is a dictionary that has it, else null.
  const Value* find(std::string_view key) const;

  // One line of text for logs: dictionaries as {key = value; …}, arrays as (…), data as <hex>.
  // Long ones are cut.
  std::string description() const;
  // The name of the type for messages, such as "string" or "dictionary".
  std::string_view typeName() const;

  // Numbers compare by type and value: int64 1 and uint64 1 are equal (the same integer), a bool or
  // a double is not equal to an integer.
  bool operator==(const Value& other) const;

  using Storage = std::variant<std::monostate, bool, int64_t, uint64_t, double, std::string, Data,
                               UUID, Date, Array, Dictionary>;
  // For visitors such as the encoders.
  const Storage& storage() const { return storage_; }

 private:
  Storage storage_;
};

}  // namespace platform

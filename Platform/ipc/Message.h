// A message: the dictionary that is the body of every frame.
//
// A reader asks for a key by type and gets nothing for another type or a missing key.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "Platform/values/Value.h"

namespace platform::ipc {

class Message {
 public:
  Message() = default;
  explicit Message(Value::Dictionary values) : values_(std::move(values)) {}

  std::optional<uint64_t> uint64(std::string_view key) const;
  std::optional<int64_t> int64(std::string_view key) const;
  std::optional<bool> boolean(std::string_view key) const;
  const std::string* string(std::string_view key) const;
  const UUID* uuid(std::string_view key) const;
  const Value::Data* data(std::string_view key) const;
  const Value::Array* array(std::string_view key) const;
  const Value::Dictionary* dictionary(std::string_view key) const;
  const Value* value(std::string_view key) const;

  void set(std::string key, Value value) {
    values_.insert_or_assign(std::move(key), std::move(value));
  }

  const Value::Dictionary& values() const { return values_; }

 private:
  Value::Dictionary values_;
};

}  // namespace platform::ipc

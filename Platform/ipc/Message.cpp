#include "Platform/ipc/Message.h"

namespace platform::ipc {

const Value* Message::value(std::string_view key) const {
  const auto found = values_.find(key);
  return found == values_.end() ? nullptr : &found->second;
}

std::optional<uint64_t> Message::uint64(std::string_view key) const {
  const Value* found = value(key);
  return found == nullptr ? std::nullopt : found->asUInt64();
}

std::optional<int64_t> Message::int64(std::string_view key) const {
  const Value* found = value(key);
  return found == nullptr ? std::nullopt : found->asInt64();
}

std::optional<bool> Message::boolean(std::string_view key) const {
  const Value* found = value(key);
  const bool* boolean = found == nullptr ? nullptr : found->asBool();
  return boolean == nullptr ? std::nullopt : std::optional(*boolean);
}

const std::string* Message::string(std::string_view key) const {
  const Value* found = value(key);
  return found == nullptr ? nullptr : found->asString();
}

const UUID* Message::uuid(std::string_view key) const {
  const Value* found = value(key);
  return found == nullptr ? nullptr : found->asUUID();
}

const Value::Data* Message::data(std::string_view key) const {
  const Value* found = value(key);
  return found == nullptr ? nullptr : found->asData();
}

const Value::Array* Message::array(std::string_view key) const {
  const Value* found = value(key);
  return found == nullptr ? nullptr : found->asArray();
}

const Value::Dictionary* Message::dictionary(std::string_view key) const {
  const Value* found = value(key);
  return found == nullptr ? nullptr : found->asDictionary();
}

}  // namespace platform::ipc

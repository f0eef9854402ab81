#include "Client/Wire.h"

#include <fmt/format.h>

using platform::Value;
using platform::ipc::Message;

namespace tessary {

std::unexpected<Error> missing(std::string_view key) {
  return std::unexpected(Error{.kind = Error::Kind::protocol,
                               .code = 0,
                               .text = fmt::format("the reply has no valid \"{}\"", key)});
}

std::optional<std::string> optionalString(const Message& reply, std::string_view key) {
  const std::string* value = reply.string(key);
  return value == nullptr ? std::nullopt : std::optional(*value);
}

std::optional<std::vector<std::string>> strings(const Message& reply, std::string_view key) {
  const Value::Array* array = reply.array(key);
  if (array == nullptr) return std::nullopt;
  std::vector<std::string> list;
  list.reserve(array->size());
  for (const Value& element : *array) {
    if (element.asString() == nullptr) return std::nullopt;
    list.push_back(*element.asString());
  }
  return list;
}

}  // namespace tessary

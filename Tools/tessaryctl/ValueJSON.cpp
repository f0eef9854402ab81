#include "Tools/tessaryctl/ValueJSON.h"

#include <sodium.h>

#include <nlohmann/json.hpp>

using nlohmann::ordered_json;
using platform::Date;
using platform::UUID;
using platform::Value;

namespace {

constexpr char kData[] = "data";
constexpr char kDate[] = "date";

std::string base64(const Value::Data& data) {
  constexpr int kVariant = sodium_base64_VARIANT_ORIGINAL;
  std::string text(sodium_base64_encoded_len(data.size(), kVariant), '\0');
  sodium_bin2base64(text.data(), text.size(), data.data(), data.size(), kVariant);
  text.pop_back();  // its terminator
  return text;
}

Value::Data dataOf(const std::string& text) {
  Value::Data data(text.size());
  size_t size = 0;
  if (sodium_base642bin(data.data(), data.size(), text.data(), text.size(), nullptr, &size, nullptr,
                        sodium_base64_VARIANT_ORIGINAL) != 0) {
    throw std::invalid_argument("no base64 under \"data\"");
  }
  data.resize(size);
  return data;
}

bool isOnly(const ordered_json& object, const char* key) {
  return object.size() == 1 && object.contains(key);
}

Value fromJSON(const ordered_json& json) {
  switch (json.type()) {
    case ordered_json::value_t::boolean:
      return json.get<bool>();
    case ordered_json::value_t::number_integer:
      return json.get<int64_t>();
    case ordered_json::value_t::number_unsigned:
      return json.get<uint64_t>();
    case ordered_json::value_t::number_float:
      return json.get<double>();
    case ordered_json::value_t::string:
      return json.get<std::string>();
    case ordered_json::value_t::array: {
      Value::Array array;
      for (const ordered_json& element : json) array.push_back(fromJSON(element));
      return array;
    }
    case ordered_json::value_t::object: {
      if (isOnly(json, kData)) return dataOf(json[kData].get<std::string>());
      if (isOnly(json, kDate)) return Date{json[kDate].get<double>()};
      Value::Dictionary dictionary;
      for (const auto& [key, element] : json.items()) dictionary.emplace(key, fromJSON(element));
      return dictionary;
    }
    default:
      throw std::invalid_argument("null is no info value");
  }
}

struct ToJSON {
  ordered_json operator()(std::monostate) const { return nullptr; }
  ordered_json operator()(const Value::Data& data) const { return {{kData, base64(data)}}; }
  ordered_json operator()(const UUID& uuid) const { return uuid.string(); }
  ordered_json operator()(const Date& date) const { return {{kDate, date.secondsSince1970}}; }
  ordered_json operator()(const Value::Array& array) const {
    ordered_json list = ordered_json::array();
    for (const Value& element : array) list.push_back(std::visit(*this, element.storage()));
    return list;
  }
  ordered_json operator()(const Value::Dictionary& dictionary) const {
    ordered_json object = ordered_json::object();
    for (const auto& [key, element] : dictionary)
      object[key] = std::visit(*this, element.storage());
    return object;
  }
  template <typename Scalar>
  ordered_json operator()(const Scalar& scalar) const {
    return scalar;
  }
};

}  // namespace

std::expected<Value, std::string> valueOfJSON(const std::string& text) {
  try {
    return fromJSON(ordered_json::parse(text));
  } catch (const std::exception& problem) {
    return std::unexpected(problem.what());
  }
}

std::string jsonOfValue(const Value& value) {
  return std::visit(ToJSON(), value.storage()).dump();
}

// Property lists: read in the binary and the XML form, written in the binary form.
//
// The readers stand any bytes. They allocate nothing that the input's own size does not justify,
// keep to the limits below and never recurse without bound. All functions may be called from any
// thread.
#pragma once

#include <cstdint>
#include <expected>
#include <span>
#include <string>
#include <string_view>

#include "Platform/values/Value.h"

namespace platform {

struct PropertyListLimits {
  static constexpr size_t kBytes = 16 * 1024 * 1024;
  // Of the XML form, which is only read: its elements take many times their size in memory.
  static constexpr size_t kXMLBytes = 2 * 1024 * 1024;
  static constexpr size_t kDepth = 64;
  // Values in the whole tree, an object that is shared counted each time that it is used.
  static constexpr size_t kValues = 1024 * 1024;
};

// Why bytes are no property list, or a value has no property-list form. For log lines.
struct PropertyListError {
  std::string reason;
};

template <typename T>
using PropertyListResult = std::expected<T, PropertyListError>;

// Reads either form: binary when the bytes begin with "bplist", XML otherwise.
PropertyListResult<Value> readPropertyList(std::span<const uint8_t> bytes);
PropertyListResult<Value> readBinaryPropertyList(std::span<const uint8_t> bytes);
PropertyListResult<Value> readXMLPropertyList(std::string_view text);

// Writes the binary form. Null and UUID values, and trees over the limits, are refused.
PropertyListResult<Value::Data> writeBinaryPropertyList(const Value& value);

}  // namespace platform

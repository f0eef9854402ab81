// What both property-list fuzzers check of a value that was read.
#pragma once

#include <cstdlib>

#include "Platform/values/PropertyList.h"

namespace platform {

// Stops the process unless the value, if it can be written, reads back equal and writes alike. Only
// what is not equal to itself, such as a NaN, is held to the second alone.
inline void checkRoundTrip(const Value& value) {
  if (value.description().empty() && value != Value("")) std::abort();
  const auto written = writeBinaryPropertyList(value);
  if (!written) return;
  const auto readBack = readBinaryPropertyList(*written);
  // What holds a NaN is not even equal to itself.
  const bool isComparable = value == value;  // NOLINT(misc-redundant-expression)
  if (!readBack || (isComparable && *readBack != value)) std::abort();
  const auto writtenAgain = writeBinaryPropertyList(*readBack);
  if (!writtenAgain || *writtenAgain != *written) std::abort();
}

}  // namespace platform

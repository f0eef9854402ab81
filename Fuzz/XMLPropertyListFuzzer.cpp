#include <cstddef>
#include <cstdint>

#include "Fuzz/PropertyListRoundTrip.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
  const auto value = platform::readXMLPropertyList({reinterpret_cast<const char*>(bytes), size});
  if (value) platform::checkRoundTrip(*value);
  return 0;
}

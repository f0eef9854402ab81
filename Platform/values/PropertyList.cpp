#include "Platform/values/PropertyList.h"

#include "Platform/values/BinaryPropertyListFormat.h"

namespace platform {

PropertyListResult<Value> readPropertyList(std::span<const uint8_t> bytes) {
  const std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  return text.starts_with(binary_property_list::kMagic) ? readBinaryPropertyList(bytes)
                                                        : readXMLPropertyList(text);
}

}  // namespace platform

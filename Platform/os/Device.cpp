#include "Platform/os/Device.h"

#include <limits>

#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/RuntimeDirectory.h"

namespace platform {
namespace {

bool isTrue(const Value* value) {
  return value != nullptr && value->booleanOfNumber().value_or(false);
}

const Value* valueAt(const Value::Dictionary& dictionary, std::string_view key) {
  const auto found = dictionary.find(key);
  return found == dictionary.end() ? nullptr : &found->second;
}

}  // namespace

Device::Device(const FileSystem& files)
    : settings_(
          readConfigurationDictionary(files, configurationDirectory(files) + "/device.plist")) {}

std::optional<uint32_t> Device::multiUserFlags() const {
  const Value* value = valueAt(settings_, "MultiUserFlags");
  if (value == nullptr) return 0;
  const auto flags = value->asUInt64();
  if (!flags || *flags > std::numeric_limits<uint32_t>::max()) return std::nullopt;
  return static_cast<uint32_t>(*flags);
}

bool Device::personasRuledOut() const {
  return isTrue(valueAt(settings_, "PersonasRuledOut"));
}

bool Device::usesEphemeralStorage() const {
  return isTrue(valueAt(settings_, "EphemeralStorage"));
}

bool Device::featureEnabled(std::string_view domain, std::string_view name) const {
  const Value* features = valueAt(settings_, "Features");
  const Value* names = features == nullptr ? nullptr : features->find(domain);
  return names != nullptr && isTrue(names->find(name));
}

}  // namespace platform

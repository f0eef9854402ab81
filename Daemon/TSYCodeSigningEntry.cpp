#include "Daemon/TSYCodeSigningEntry.h"

#include <fmt/format.h>

#include "Daemon/TSYPropertyList.h"

using platform::Value;

namespace {

constexpr char kCodeSigningInfo[] = "CodeSigningInfo";
constexpr char kChildBundleIds[] = "ChildBundleIds";
constexpr char kInvalid[] = "Invalid";
constexpr char kPlaceholder[] = "Placeholder";
constexpr char kAdvanceCopy[] = "AdvanceCopy";
constexpr char kRegisteredByCaller[] = "RegisteredByCaller";
constexpr char kDataContainerClass[] = "DataContainerClass";

Value arrayOf(const std::vector<std::string>& texts) {
  return Value::Array(texts.begin(), texts.end());
}

Value childrenOrNull(const TSYCodeSigningEntry& entry) {
  return entry.childBundleIdentifiers ? arrayOf(*entry.childBundleIdentifiers) : Value();
}

Value infoOrNull(const TSYCodeSigningEntry& entry) {
  return entry.codeSigningInfo ? Value(*entry.codeSigningInfo) : Value();
}

// Equal values have equal descriptions.
size_t hashOf(const Value& value) {
  return value.isNull() ? 0 : std::hash<std::string>{}(value.description());
}

char letterOf(bool flag) {
  return flag ? 'Y' : 'N';
}

}  // namespace

TSYCodeSigningEntry::TSYCodeSigningEntry(Info info, uint64_t containerClass)
    : codeSigningInfo(std::move(info)), dataContainerClass(containerClass) {}

TSYCodeSigningEntry TSYCodeSigningEntry::fromSerializedDictionary(
    const Value::Dictionary& serialized) {
  TSYCodeSigningEntry entry;
  entry.invalid = TSYFlagUnder(serialized, kInvalid);
  entry.placeholder = TSYFlagUnder(serialized, kPlaceholder);
  entry.advanceCopy = TSYFlagUnder(serialized, kAdvanceCopy);
  entry.registeredByCaller = TSYFlagUnder(serialized, kRegisteredByCaller);
  if (const auto found = serialized.find(kCodeSigningInfo);
      found != serialized.end() && found->second.asDictionary() != nullptr) {
    entry.codeSigningInfo =
        std::make_shared<const Value::Dictionary>(*found->second.asDictionary());
  }
  if (const auto found = serialized.find(kChildBundleIds);
      found != serialized.end() && found->second.asArray() != nullptr) {
    entry.childBundleIdentifiers.emplace();
    for (const Value& child : *found->second.asArray()) {
      if (child.asString() != nullptr) entry.childBundleIdentifiers->push_back(*child.asString());
    }
  }
  if (const auto found = serialized.find(kDataContainerClass); found != serialized.end()) {
    entry.dataContainerClass = found->second.unsignedOfNumber().value_or(0);
  }
  return entry;
}

Value::Dictionary TSYCodeSigningEntry::serialize() const {
  Value::Dictionary serialized{{kInvalid, invalid},
                               {kPlaceholder, placeholder},
                               {kAdvanceCopy, advanceCopy},
                               {kRegisteredByCaller, registeredByCaller},
                               {kDataContainerClass, dataContainerClass}};
  if (codeSigningInfo) serialized.emplace(kCodeSigningInfo, *codeSigningInfo);
  if (childBundleIdentifiers) serialized.emplace(kChildBundleIds, arrayOf(*childBundleIdentifiers));
  return serialized;
}

bool TSYCodeSigningEntry::operator==(const TSYCodeSigningEntry& other) const {
  const bool hasSameInfo =
      codeSigningInfo == other.codeSigningInfo ||
      (codeSigningInfo && other.codeSigningInfo && *codeSigningInfo == *other.codeSigningInfo);
  return hasSameInfo && childBundleIdentifiers == other.childBundleIdentifiers &&
         invalid == other.invalid && placeholder == other.placeholder &&
         advanceCopy == other.advanceCopy && registeredByCaller == other.registeredByCaller &&
         dataContainerClass == other.dataContainerClass;
}

size_t TSYCodeSigningEntry::hash() const {
  size_t hash = hashOf(infoOrNull(*this)) ^ hashOf(childrenOrNull(*this));
  if (invalid) hash += 2;
  if (placeholder) hash += 4;
  if (registeredByCaller) hash += 8;
  if (dataContainerClass != 0) hash += 16;
  if (advanceCopy) hash += 32;
  return hash;
}

std::string TSYCodeSigningEntry::description() const {
  return fmt::format(
      "<TSYCodeSigningEntry invalid: {}, placeholder: {}, advanceCopy: {}, regByCaller: {}, "
      "dataClass: {}, childBundles: {}, CSinfo: {}>",
      letterOf(invalid), letterOf(placeholder), letterOf(advanceCopy), letterOf(registeredByCaller),
      dataContainerClass, childrenOrNull(*this).description(), infoOrNull(*this).description());
}

// What entitlements say of containers.
#include <set>

#include "Daemon/TSYCodeSigningKeys.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYPropertyList.h"

using platform::Value;

namespace {

constexpr std::string_view kSystemGroupPrefix = "systemgroup.";

const Value* valueUnder(const TSYCodeSigningMapping::Entitlements& entitlements, const char* key) {
  return entitlements ? TSYValueUnder(*entitlements, key) : nullptr;
}

}  // namespace

TSYCodeSigningMapping::Identifiers
TSYCodeSigningMapping::_copyApplicationGroupEntitlementForIdentifier(
    const std::string& identifier, const Entitlements& entitlements, const char* groupKey) {
  const Value* value = valueUnder(entitlements, groupKey);
  if (value == nullptr) return std::nullopt;
  if (const std::string* text = value->asString()) return std::vector<std::string>{*text};
  const Value::Array* array = value->asArray();
  if (array == nullptr) {
    TSYLogWrite(TSYLogLevelError,
                "Entitlement {} for {} does not contain supported types; ignoring.", groupKey,
                identifier);
    return std::nullopt;
  }
  std::set<std::string> distinct;
  for (const Value& element : *array) {
    const std::string* text = element.asString();
    if (text == nullptr) {
      TSYLogWrite(TSYLogLevelError, "Entitlement {} for {} contains non-string values; ignoring.",
                  groupKey, identifier);
      return std::nullopt;
    }
    distinct.insert(*text);
  }
  return std::vector<std::string>(distinct.begin(), distinct.end());
}

TSYCodeSigningMapping::Identifiers TSYCodeSigningMapping::_appGroupIdentifiersForIdentifier(
    const std::string& identifier, const Entitlements& entitlements) {
  return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                       kTSYEntitlementApplicationGroups);
}

TSYCodeSigningMapping::Identifiers TSYCodeSigningMapping::allSystemGroupIdentifiers(
    const std::string& identifier, const Entitlements& entitlements) {
  auto groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                              kTSYEntitlementSystemGroups);
  if (groups && !groups->empty()) return groups;
  return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                       kTSYEntitlementSystemGroupContainers);
}

TSYCodeSigningMapping::Identifiers TSYCodeSigningMapping::_systemGroupIdentifiersForIdentifier(
    const std::string& identifier, const Entitlements& entitlements) {
  auto groups = allSystemGroupIdentifiers(identifier, entitlements);
  if (!groups) return groups;
  std::erase_if(*groups, [](const std::string& group) {
    if (group.starts_with(kSystemGroupPrefix)) return false;
    TSYLogWrite(TSYLogLevelError, "System group ID {} does not have proper prefix, ignoring.",
                group);
    return true;
  });
  return groups;
}

bool TSYCodeSigningMapping::_entitlementsHasSystemContainer(const Entitlements& entitlements) {
  return entitlements && TSYFlagUnder(*entitlements, kTSYEntitlementSystemContainer);
}

TSYCodeSigningMapping::Info TSYCodeSigningMapping::_codeSigningInfoForCodeSigningEntry(
    const TSYCodeSigningEntryRef& entry, bool externalRequest) {
  if (!entry) return nullptr;
  const bool isVague = entry->placeholder || entry->advanceCopy || entry->invalid;
  return externalRequest && isVague ? nullptr : entry->codeSigningInfo;
}

// Shares the information that it is a part of.
TSYCodeSigningMapping::Entitlements TSYCodeSigningMapping::_entitlementsFromInfo(const Info& info) {
  if (!info) return nullptr;
  const Value* value = TSYValueUnder(*info, kTSYCodeSigningEntitlements);
  if (value == nullptr) return nullptr;
  const Value::Dictionary* entitlements = value->asDictionary();
  return entitlements == nullptr ? nullptr : Entitlements(info, entitlements);
}

TSYCodeSigningMapping::Entitlements TSYCodeSigningMapping::_entitlementsFromCodeSigningEntry(
    const TSYCodeSigningEntryRef& entry) {
  return _entitlementsFromInfo(
      _codeSigningInfoForCodeSigningEntry(entry, /*externalRequest=*/false));
}

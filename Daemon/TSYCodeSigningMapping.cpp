#include "Daemon/TSYCodeSigningMapping.h"

#include "Daemon/TSYErrorCode.h"

TSYCodeSigningMapping& TSYCodeSigningMapping::sharedInstance() {
  static TSYCodeSigningMapping instance;
  return instance;
}

uint64_t TSYCodeSigningMapping::processCallerRegisteredEntitlements(
    const platform::Value::Dictionary& /*entitlements*/, const std::string& /*forIdentifier*/,
    TSYCommandQueue& /*commandQueue*/) {
  return TSYErrorSuccess;
}

TSYCodeSigningMapping::Entitlements TSYCodeSigningMapping::entitlementsForIdentifier(
    const std::string& /*identifier*/) {
  return nullptr;
}

bool TSYCodeSigningMapping::identifierHasSystemContainer(const std::string& /*identifier*/) {
  return false;
}

std::optional<std::string> TSYCodeSigningMapping::parentIdentifierForChildIdentifier(
    const std::string& /*identifier*/) {
  return std::nullopt;
}

std::optional<std::vector<std::string>> TSYCodeSigningMapping::appGroupIdentifiersForIdentifier(
    const std::string& /*identifier*/) {
  return std::nullopt;
}

std::optional<std::vector<std::string>> TSYCodeSigningMapping::systemGroupIdentifiersForIdentifier(
    const std::string& /*identifier*/) {
  return std::nullopt;
}

void TSYCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& /*identifier*/, TSYCommandQueue& /*commandQueue*/) {}

TSYResult<void> TSYCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(
    const std::string& /*identifier*/) {
  return {};
}

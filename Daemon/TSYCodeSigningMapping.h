// What every installed application and plug-in is entitled to.
//
// Its database is not built yet: the mapping knows of no entry, so nobody has a parent, a system
// container or registered entitlements, and what is registered or removed is accepted and
// forgotten.
//
// All operations may be called from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/TSYError.h"
#include "Platform/values/Value.h"

class TSYCommandQueue;

class TSYCodeSigningMapping {
 public:
  using Entitlements = std::shared_ptr<const platform::Value::Dictionary>;

  static TSYCodeSigningMapping& sharedInstance();

  // Registers what a caller of the daemon is entitled to. What has to be deleted for it is put on
  // `commandQueue`. Returns a TSYErrorCode.
  uint64_t processCallerRegisteredEntitlements(const platform::Value::Dictionary& entitlements,
                                               const std::string& forIdentifier,
                                               TSYCommandQueue& commandQueue);
  // Null without an entry.
  Entitlements entitlementsForIdentifier(const std::string& identifier);
  bool identifierHasSystemContainer(const std::string& identifier);
  // The application that a plug-in belongs to.
  std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& identifier);
  // The groups that an entry names in its entitlements; none without an entry.
  std::optional<std::vector<std::string>> appGroupIdentifiersForIdentifier(
      const std::string& identifier);
  std::optional<std::vector<std::string>> systemGroupIdentifiersForIdentifier(
      const std::string& identifier);

  // Forgets an application and the plug-ins under it: its bundle container goes.
  void removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                TSYCommandQueue& commandQueue);
  // Marks them as out of date: another bundle takes the container's place.
  TSYResult<void> invalidateCodeSigningInfoForIdentifierAndItsChildren(
      const std::string& identifier);
};

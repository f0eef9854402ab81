// Which containers lose their last reference when entitlements change.
//
// Their deletion is decided here, on the queue, and done when the request that caused it completes,
// under the global write lock. In between somebody else may have registered an entry that names the
// container, and got its path: so the reference is looked for once more, under that lock. An entry
// that is registered even later finds no container, and gets a new one.
#include <algorithm>

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYCommandStageForDelete.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLog.h"

using platform::LogLevel;

namespace {

std::vector<TSYContainerIdentityRef> listOf(TSYContainerIdentity identity) {
  return {std::make_shared<const TSYContainerIdentity>(std::move(identity))};
}

int64_t countOf(const TSYCodeSigningMapping::ReferenceCounts& counts, const std::string& group) {
  const auto found = counts.find(group);
  return found == counts.end() ? 0 : found->second;
}

}  // namespace

void TSYCodeSigningMapping::_onQueue_reconcile(const std::string& identifier,
                                               const Entitlements& oldEntitlements,
                                               const Entitlements& newEntitlements,
                                               TSYCommandQueue& commandQueue) {
  if (_entitlementsHasSystemContainer(oldEntitlements) &&
      !_entitlementsHasSystemContainer(newEntitlements)) {
    queueDeletionOfSystemContainer(identifier, commandQueue);
  }
  const auto newGroups = _appGroupIdentifiersForIdentifier(identifier, newEntitlements);
  const auto oldGroups = _appGroupIdentifiersForIdentifier(identifier, oldEntitlements);
  _onQueue_handleChangeFromOldGroupContainerIds(oldGroups, newGroups, TSYGroupType::application,
                                                commandQueue);
  const auto newSystemGroups = allSystemGroupIdentifiers(identifier, newEntitlements);
  const auto oldSystemGroups = _systemGroupIdentifiersForIdentifier(identifier, oldEntitlements);
  _onQueue_handleChangeFromOldGroupContainerIds(oldSystemGroups, newSystemGroups,
                                                TSYGroupType::system, commandQueue);
  TSYSystemLogWrite(TSYChannel::codesignmapping, LogLevel::standard,
                    "Reconciled; old app groups: {}, new app groups: {}, old system groups: {}, "
                    "new system groups: {}",
                    TSYListText(oldGroups), TSYListText(newGroups), TSYListText(oldSystemGroups),
                    TSYListText(newSystemGroups));
}

void TSYCodeSigningMapping::queueDeletionOfSystemContainer(const std::string& identifier,
                                                           TSYCommandQueue& commandQueue) {
  auto identity = TSYContainerIdentity::containerIdentityWithIdentifier(
      identifier, kTSYContainerClassSystemData);
  if (!identity) {
    TSYLogWrite(TSYLogLevelError, "Failed to create system container identity for {}: {}",
                identifier, identity.error());
    return;
  }
  TSYLogWrite(TSYLogLevelError,
              "Deleting system container for ID: {} because it is no longer in the entitlements",
              identifier);
  commandQueue.insertCommand(
      TSYCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
          listOf(std::move(*identity)), /*useLocking=*/true,
          [identifier](uint64_t code) {
            TSYLogWrite(TSYLogLevelError,
                        "Failed to destroy system container with identifier {}: {}", identifier,
                        code);
          },
          [this, identifier] {
            const auto entry = codeSigningEntryForIdentifier(identifier);
            return entry &&
                   !_entitlementsHasSystemContainer(_entitlementsFromCodeSigningEntry(*entry));
          }));
}

void TSYCodeSigningMapping::_onQueue_handleChangeFromOldGroupContainerIds(
    const Identifiers& oldIds, const Identifiers& newIds, TSYGroupType type,
    TSYCommandQueue& commandQueue) {
  if (!oldIds || oldIds == newIds) return;
  std::vector<std::string> dropped = *oldIds;
  if (newIds) {
    std::erase_if(dropped, [&](const std::string& group) {
      return std::ranges::find(*newIds, group) != newIds->end();
    });
  }
  _onQueue_removeReferenceForGroupIdentifiers(dropped, type, commandQueue);
}

void TSYCodeSigningMapping::_onQueue_removeReferenceForGroupIdentifiers(
    const std::vector<std::string>& identifiers, TSYGroupType type, TSYCommandQueue& commandQueue) {
  if (identifiers.empty()) return;
  if (type == TSYGroupType::system) {
    TSYLogWrite(TSYLogLevelNotice, "Would have removed system group container references for {}",
                TSYListText(identifiers));
    return;
  }
  const auto counts = _onQueue_copyReferenceCountSetOfType(type);
  if (!counts) {
    TSYLogWrite(TSYLogLevelError, "Failed to get reference count information for group type: {}",
                static_cast<int64_t>(type));
    return;
  }
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const TSYUserIdentityRef& user) {
        queue_.assertCurrent();
        if (!configuration.getPerUserConfigurationForUserIdentity(user).existsUserBaseDirectory()) {
          return;
        }
        _onQueue_removeGroupContainersIfNeededforUserIdentity(user, kTSYContainerClassAppGroup,
                                                              identifiers, *counts, commandQueue);
      });
}

void TSYCodeSigningMapping::_onQueue_removeGroupContainersIfNeededforUserIdentity(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass groupContainerClass,
    const std::vector<std::string>& identifiers, const ReferenceCounts& referenceCounts,
    TSYCommandQueue& commandQueue) {
  for (const std::string& group : identifiers) {
    // The entry that is being changed holds the last reference.
    if (countOf(referenceCounts, group) == 1) {
      queueDeletionOfGroupContainer(userIdentity, group, groupContainerClass, commandQueue);
      continue;
    }
    TSYSystemLogWrite(TSYChannel::codesignmapping, LogLevel::standard,
                      "Reference count for user: {}, ID: {} is {}",
                      userIdentity->shortDescription(), group, countOf(referenceCounts, group));
  }
}

void TSYCodeSigningMapping::queueDeletionOfGroupContainer(const TSYUserIdentityRef& userIdentity,
                                                          const std::string& group,
                                                          TSYContainerClass groupContainerClass,
                                                          TSYCommandQueue& commandQueue) {
  auto identity = TSYContainerIdentity::containerIdentityWithUserIdentity(userIdentity, group,
                                                                          groupContainerClass);
  if (!identity) return;  // logged
  commandQueue.insertCommand(
      TSYCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
          listOf(std::move(*identity)), /*useLocking=*/true,
          [group, userIdentity](uint64_t code) {
            TSYLogWrite(TSYLogLevelError,
                        "Failed to destroy group container with identifier {} for {}: {}", group,
                        userIdentity->shortDescription(), code);
          },
          [this, group] { return !isReferenced(group); }));
}

// What cannot be told counts as a reference.
bool TSYCodeSigningMapping::isReferenced(const std::string& group) {
  const auto counts = copyReferenceCountSetOfType(TSYGroupType::application);
  return !counts || countOf(*counts, group) > 0;
}

std::optional<TSYCodeSigningMapping::ReferenceCounts>
TSYCodeSigningMapping::copyReferenceCountSetOfType(TSYGroupType type) {
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_copyReferenceCountSetOfType(type);
  });
}

std::optional<TSYCodeSigningMapping::ReferenceCounts>
TSYCodeSigningMapping::_onQueue_copyReferenceCountSetOfType(TSYGroupType type) {
  ReferenceCounts counts;
  const auto enumerated = codeSigningMappingDB_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& identifier, const TSYCodeSigningEntry& entry) {
        addReferences(counts, type, identifier, entry);
      });
  if (enumerated) return counts;
  TSYLogWrite(TSYLogLevelError, "Failed to enumerate code signing info: {}", enumerated.error());
  return std::nullopt;
}

void TSYCodeSigningMapping::addReferences(ReferenceCounts& counts, TSYGroupType type,
                                          const std::string& identifier,
                                          const TSYCodeSigningEntry& entry) {
  const Entitlements entitlements = _entitlementsFromInfo(entry.codeSigningInfo);
  const auto groups = type == TSYGroupType::system
                          ? allSystemGroupIdentifiers(identifier, entitlements)
                          : _appGroupIdentifiersForIdentifier(identifier, entitlements);
  if (!groups) return;
  for (const std::string& group : *groups) ++counts[group];
  if (TSYLogIsEnabled(TSYLogLevelDebug)) {
    TSYLogWrite(TSYLogLevelDebug, "Entitlements for identifier {} references container IDs: {}",
                identifier, TSYListText(groups));
  }
}

// Asking the mapping, and marking its entries as out of date.
#include "Daemon/TSYCodeSigningMapping.h"

#include <algorithm>
#include <array>

#include "Daemon/TSYCodeSigningKeys.h"
#include "Daemon/TSYCommandQueue.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYGroupManager.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"

using platform::Value;

namespace {

// What an older installer has left in the info dictionary of an application's bundle container.
constexpr char kCachedCodeSigningInfo[] = "com.veltra.Hatchery.CachedCodeSigningInfo";
constexpr char kCachedEntitlements[] = "Entitlements";

bool isPlugInClass(uint64_t dataContainerClass) {
  return dataContainerClass >= kTSYContainerClassPluginBundle &&
         dataContainerClass <= kTSYContainerClassVPNPluginData;
}

// The regular bundle container of an identifier.
TSYResult<TSYMetadataRef> findBundle(const std::string& identifier,
                                     TSYContainerClass containerClass) {
  auto identity = TSYContainerIdentity::containerIdentityWithIdentifier(identifier, containerClass);
  if (!identity) return TSYFailure(std::move(identity.error()));
  return TSYContainerCache::sharedInstance().containerForContainerIdentity(
      *identity, /*transient=*/false, /*updateSandbox=*/false);
}

// A bundle that cannot be looked for counts as there.
bool mayHaveBundle(const std::string& identifier) {
  constexpr std::array kClasses = {kTSYContainerClassAppBundle, kTSYContainerClassPluginBundle,
                                   kTSYContainerClassVPNPluginBundle};
  return std::ranges::any_of(kClasses, [&](TSYContainerClass containerClass) {
    const auto found = findBundle(identifier, containerClass);
    return found ||
           !(found.error().is(TSYErrorNotFound) || found.error().is(TSYErrorCacheInconsistent));
  });
}

}  // namespace

std::unique_ptr<TSYCodeSigningMapping> TSYCodeSigningMapping::openShared() {
  try {
    return std::make_unique<TSYCodeSigningMapping>(
        TSYUserIdentitySharedCache::sharedInstance(),
        std::make_unique<TSYSQLiteDB>(TSYGlobalConfiguration::sharedInstance().libraryDirectory()));
  } catch (const std::bad_alloc&) {
    TSYLogWrite(TSYLogLevelError, "Failed to initialize database.");
    throw;
  }
}

TSYCodeSigningMapping& TSYCodeSigningMapping::sharedInstance() {
  // Never destroyed: threads may still be waiting for its queue when the process ends.
  static TSYCodeSigningMapping& instance = *openShared().release();
  return instance;
}

TSYCodeSigningMapping::TSYCodeSigningMapping(TSYUserIdentityCache& userIdentityCache,
                                             std::unique_ptr<TSYSQLiteDB> codeSigningMappingDB)
    : userIdentityCache_(userIdentityCache),
      codeSigningMappingDB_(std::move(codeSigningMappingDB)) {
  onQueue([&] {
    queue_.assertCurrent();
    _onQueue_migrateFromMappingFileToDBIfNecessary();
  });
}

void TSYCodeSigningMapping::close() {
  onQueue([&] {
    queue_.assertCurrent();
    codeSigningMappingDB_->closeDB();
    queue_.suspend();
  });
}

// --- Entries ------------------------------------------------------------------------------------

TSYResult<TSYCodeSigningEntryRef> TSYCodeSigningMapping::codeSigningEntryForIdentifier(
    const std::string& identifier) {
  if (auto known = entries_.find(identifier)) return std::move(*known);
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_codeSigningEntryForIdentifier(identifier);
  });
}

TSYResult<TSYCodeSigningEntryRef> TSYCodeSigningMapping::_onQueue_codeSigningEntryForIdentifier(
    const std::string& identifier) {
  if (auto known = entries_.find(identifier)) return std::move(*known);
  auto read = codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier);
  if (!read && !read.error().is(TSYErrorNotFoundInDatabase)) {
    TSYLogWrite(TSYLogLevelError, "Error retrieving entry from DB with identifier {} : {}",
                identifier, read.error());
    return TSYFailure(std::move(read.error()));
  }
  TSYCodeSigningEntryRef entry =
      read ? std::make_shared<const TSYCodeSigningEntry>(std::move(*read)) : nullptr;
  entries_.store(identifier, entry);
  return entry;
}

TSYCodeSigningMapping::Info TSYCodeSigningMapping::_onQueue_codeSigningInfoForIdentifier(
    const std::string& identifier, bool externalRequest) {
  const auto entry = _onQueue_codeSigningEntryForIdentifier(identifier);
  return entry ? _codeSigningInfoForCodeSigningEntry(*entry, externalRequest) : nullptr;
}

TSYCodeSigningMapping::Info TSYCodeSigningMapping::getCodeSigningInfoForIdentifier(
    const std::string& identifier) {
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
  // Takes over what is with the bundle container.
  (void)entitlementsForIdentifier(identifier);
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_codeSigningInfoForIdentifier(identifier, /*externalRequest=*/true);
  });
}

uint64_t TSYCodeSigningMapping::dataContainerTypeForIdentifier(const std::string& identifier) {
  const auto entry = codeSigningEntryForIdentifier(identifier);
  return entry && *entry ? (*entry)->dataContainerClass : 0;
}

bool TSYCodeSigningMapping::identifierHasCallerRegisteredEntitlements(
    const std::string& identifier) {
  const auto entry = codeSigningEntryForIdentifier(identifier);
  return entry && *entry && (*entry)->registeredByCaller;
}

// --- Entitlements -------------------------------------------------------------------------------

TSYCodeSigningMapping::Entitlements TSYCodeSigningMapping::entitlementsForIdentifier(
    const std::string& identifier) {
  const auto entry = codeSigningEntryForIdentifier(identifier);
  // One that cannot be read is there all the same.
  if (!entry) return nullptr;
  if (*entry) return _entitlementsFromCodeSigningEntry(*entry);
  return takeOverFromBundleContainer(identifier);
}

TSYCodeSigningMapping::Entitlements TSYCodeSigningMapping::takeOverFromBundleContainer(
    const std::string& identifier) {
  const auto bundle = findBundle(identifier, kTSYContainerClassAppBundle);
  if (!bundle || !(*bundle)->info()) return nullptr;
  const auto cached = (*bundle)->info()->find(kCachedCodeSigningInfo);
  if (cached == (*bundle)->info()->end() || cached->second.asDictionary() == nullptr) {
    return nullptr;
  }
  TSYLogWrite(TSYLogLevelNotice,
              "Migrating code signing info from bundle container upon request for {}", identifier);
  Value::Dictionary info = *cached->second.asDictionary();
  if (const auto found = info.find(kCachedEntitlements); found != info.end()) {
    info.insert_or_assign(kTSYCodeSigningEntitlements, Value(found->second));
  }
  const TSYCodeSigningEntry entry(std::make_shared<const Value::Dictionary>(std::move(info)),
                                  kTSYContainerClassAppData);
  return onQueue([&]() -> Entitlements {
    queue_.assertCurrent();
    // What has been registered meanwhile is newer.
    const auto now = _onQueue_codeSigningEntryForIdentifier(identifier);
    if (!now) return nullptr;
    if (*now) return _entitlementsFromCodeSigningEntry(*now);
    const auto added =
        _onQueue_change([&](TSYSQLiteDB& db) { return db.addCodeSigningEntry(entry, identifier); });
    if (!added) {
      TSYLogWrite(TSYLogLevelError, "Failed to write code signing info to DB for {} : {}",
                  identifier, added.error());
    }
    return _entitlementsFromInfo(entry.codeSigningInfo);
  });
}

TSYCodeSigningMapping::Identifiers TSYCodeSigningMapping::appGroupIdentifiersForIdentifier(
    const std::string& identifier) {
  return _appGroupIdentifiersForIdentifier(identifier, entitlementsForIdentifier(identifier));
}

TSYCodeSigningMapping::Identifiers TSYCodeSigningMapping::systemGroupIdentifiersForIdentifier(
    const std::string& identifier) {
  return _systemGroupIdentifiersForIdentifier(identifier, entitlementsForIdentifier(identifier));
}

bool TSYCodeSigningMapping::identifierHasSystemContainer(const std::string& identifier) {
  return _entitlementsHasSystemContainer(entitlementsForIdentifier(identifier));
}

// --- Parents and children -----------------------------------------------------------------------

TSYCodeSigningMapping::Identifiers TSYCodeSigningMapping::childBundleIdentifiersForParentIdentifier(
    const std::string& identifier) {
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_childBundleIdentifiersForParentIdentifier(identifier);
  });
}

TSYCodeSigningMapping::Identifiers
TSYCodeSigningMapping::_onQueue_childBundleIdentifiersForParentIdentifier(
    const std::string& identifier) {
  auto children = codeSigningMappingDB_->childIdentifiersForParentIdentifier(identifier);
  if (children) return std::move(*children);
  if (!children.error().is(TSYErrorNotFoundInDatabase)) {
    TSYLogWrite(TSYLogLevelError,
                "Error retrieving child bundles ids from DB with identifier {} : {}", identifier,
                children.error());
  }
  return std::nullopt;
}

std::optional<std::string> TSYCodeSigningMapping::parentIdentifierForChildIdentifier(
    const std::string& identifier) {
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_parentIdentifierForChildIdentifier(identifier);
  });
}

std::optional<std::string> TSYCodeSigningMapping::_onQueue_parentIdentifierForChildIdentifier(
    const std::string& identifier) {
  auto parent = codeSigningMappingDB_->parentIdentifierForChildIdentifier(identifier);
  if (parent) return std::move(*parent);
  if (!parent.error().is(TSYErrorNotFoundInDatabase)) {
    TSYLogWrite(TSYLogLevelError,
                "Error retrieving child bundles ids from DB with identifier {} : {}", identifier,
                parent.error());
  }
  return std::nullopt;
}

TSYResult<std::vector<std::string>> TSYCodeSigningMapping::identifiers() {
  return onQueue([&] {
    queue_.assertCurrent();
    return codeSigningMappingDB_->identifiers();
  });
}

// --- Invalidation -------------------------------------------------------------------------------

TSYResult<void> TSYCodeSigningMapping::invalidateCodeSigningInfoForIdentifier(
    const std::string& identifier) {
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_change(
        [&](TSYSQLiteDB& db) { return db.invalidateCodeSigningWithIdentifier(identifier); });
  });
}

TSYResult<void> TSYCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(
    const std::string& identifier) {
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier);
  });
}

TSYResult<void>
TSYCodeSigningMapping::_onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(
    const std::string& identifier) {
  return _onQueue_change([&](TSYSQLiteDB& db) {
    return db.invalidateCodeSigningForIdentifierAndAllChildren(identifier);
  });
}

TSYResult<void> TSYCodeSigningMapping::removeAllAdvanceCopies() {
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_change(
        [](TSYSQLiteDB& db) { return db.deleteAllAdvanceCopiesOfCodeSigningEntries(); });
  });
}

uint64_t TSYCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
  const auto all = identifiers();
  if (!all) {
    TSYLogWrite(TSYLogLevelError,
                "Failed to enumerate containers when invalidating code signing info: {}",
                all.error());
    return TSYErrorSuccess;
  }
  uint64_t code = TSYErrorSuccess;
  for (const std::string& identifier : *all) {
    const auto done = invalidateUnlessBundled(identifier);
    if (!done) code = done.error().clientCode();
  }
  return code;
}

TSYResult<void> TSYCodeSigningMapping::invalidateUnlessBundled(const std::string& identifier) {
  bool isPlugIn = false;
  bool hasParent = false;
  const auto entry = onQueue([&] {
    queue_.assertCurrent();
    auto read = _onQueue_codeSigningEntryForIdentifier(identifier);
    isPlugIn = read && *read && isPlugInClass((*read)->dataContainerClass);
    hasParent = isPlugIn && _onQueue_parentIdentifierForChildIdentifier(identifier).has_value();
    return read;
  });
  if (!entry || !*entry) {
    TSYLogWrite(TSYLogLevelError,
                "Error fetching code sign info for {} to check for invalidation: {}", identifier,
                entry ? "it has none" : entry.error().description());
    return {};
  }
  TSYSystemLogWrite(TSYChannel::codesignmapping, platform::LogLevel::standard,
                    "Checking for invalidation: identifier = {}, codeSigningEntry = <{}>, "
                    "isRegisteredByCaller = {:d}, isPlugIn = {:d}, hasParent = {:d}",
                    identifier, fmt::ptr(entry->get()), (*entry)->registeredByCaller, isPlugIn,
                    hasParent);
  if ((*entry)->registeredByCaller || hasParent || mayHaveBundle(identifier)) return {};
  TSYLogWrite(TSYLogLevelNotice, "Invalidating: identifier = {}, isPlugin = {:d}", identifier,
              isPlugIn);
  const auto invalidated = onQueue([&]() -> TSYResult<void> {
    queue_.assertCurrent();
    // What has been registered meanwhile is not what was looked at.
    const auto now = _onQueue_codeSigningEntryForIdentifier(identifier);
    if (!now || !*now || **now != **entry) return {};
    return _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier);
  });
  if (invalidated) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorDatabase, std::nullopt, TSYLogIt::yes,
                                   "Failed to invalidate code signing info for {} : {}", identifier,
                                   invalidated.error()));
}

// --- After an update of the system --------------------------------------------------------------

// The removals go on a queue of their own, which runs before the lock is let go: between the
// counting of references and the removal nobody can create or look up a container.
void TSYCodeSigningMapping::performAllCodeSigningMigrationAndReconciliation() {
  const bool isMultiUser = platform::Platform::current().device.isMultiUser();
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
  if (!isMultiUser) migrateAppGroupIdsFromDataContainersToFile();
  onQueue([&] {
    queue_.assertCurrent();
    _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
  });
  migrateCachedCodeSigningInfoFromBundleContainersToMapping();
  if (isMultiUser) return;
  TSYCommandQueue removals;
  TSYGroupManager::defaultManager().reconcileGroupContainersOfType(TSYGroupType::application,
                                                                   removals);
  // One that fails (logged) keeps no other.
  while (!removals.executeAllUntilExhausted()) {
  }
}

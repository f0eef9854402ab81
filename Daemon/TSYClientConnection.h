// The object through which every container operation runs.
//
// One connection stands for one caller and carries who he is and what he may look up. The
// dispatcher makes one for each request; the shared one and the privileged ones are the daemon's
// own. A connection is used by one thread at a time, but for its lookup rights, which have a lock.
//
// The class is one header; its source is one file per concern.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "Daemon/TSYClientIdentity.h"
#include "Daemon/TSYCommandQueue.h"
#include "Daemon/TSYContainerIdentity.h"
#include "Daemon/TSYError.h"
#include "Daemon/TSYMetadata.h"
#include "Daemon/TSYURL.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Platform/base/Mutex.h"
#include "Platform/base/SerialQueue.h"
#include "Platform/values/Value.h"

class TSYClientConnection {
 public:
  // The lookup dictionary of the caller's entitlements: class key to a list of identifiers.
  using Lookup = std::optional<platform::Value::Dictionary>;
  using WipeIdentifiers = std::optional<platform::Value::Array>;

  // A connection for the daemon itself: entitled and unrestricted.
  TSYClientConnection();
  // `clientIdentity` may be null, for a process without an identity.
  TSYClientConnection(TSYClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup,
                      bool unrestricted, Lookup lookup, WipeIdentifiers entitledWipeIdentifiers,
                      std::shared_ptr<TSYCommandQueue> commandQueue);
  static TSYClientConnection& sharedClientConnection();
  // For the daemon's own work on behalf of a user.
  static std::unique_ptr<TSYClientConnection> privilegedClientConnectionWithUserIdentity(
      TSYUserIdentityRef userIdentity);
  // Boot-time cleanup work of the whole process.
  static platform::SerialQueue& backgroundQueue();

  const TSYClientIdentityRef& clientIdentity() const { return clientIdentity_; }
  TSYCommandQueue& commandQueue() { return *commandQueue_; }
  bool entitled() const { return entitled_; }
  bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
  bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
  bool unrestricted() const { return unrestricted_; }
  const WipeIdentifiers& entitledWipeIdentifiers() const { return entitledWipeIdentifiers_; }
  // The client's code-signing identifier; empty without an identity.
  const std::string& clientBundleIdentifier() const;
  // None without an identity.
  TSYUserIdentityRef clientUserIdentity() const;
  void setAllowOtherIdLookup(bool allow) { allowOtherIdLookup_ = allow; }
  void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }
  void setUnrestricted(bool unrestricted) { unrestricted_ = unrestricted; }

  // Runs what the operations have deferred. The dispatcher calls it after every handler.
  TSYResult<void> complete();

  // Whether the entitlements name this identifier for this class.
  bool isEntitledForLookupWithClass(TSYContainerClass containerClass,
                                    const std::string& identifier);

  // --- Create or look up -------------------------------------------------------------------------

  // Finds the container, or creates it: built in a staging directory and moved into place whole.
  // existed() of the result tells which. A transient container is never reused: a second creation
  // replaces it. With useLocking false the caller holds the identifier locks.
  //
  // Codes: 38 no identity, 55 not allowed, 21 not there and not to be created, 5, 7, 8, 9, 6, 45,
  // 40, and those of the cache (43, 46, 47), the metadata file, the identity and the access-control
  // lists. A failure never leaves a half-built container at a live path.
  TSYResult<TSYMetadataRef> createOrLookupContainerWithContainerIdentity(
      const std::optional<TSYContainerIdentity>& identity, bool createIfNecessary, bool transient,
      bool useLocking);

  // All containers of a class of the caller's user. Code 11 outside 1 to 13, and the cache's codes.
  TSYResult<std::vector<TSYMetadataRef>> containersWithClass(TSYContainerClass containerClass,
                                                             bool transient);

  // --- Deletion ----------------------------------------------------------------------------------

  // Takes an item out of sight: moves it into a new directory on death row. A missing item is
  // success. Code 41.
  static TSYResult<void> _moveItemAtURLToDeathRow(const TSYURL& url, bool startDeletionThread);
  // Empties death row on its queue and returns at once. The completion, which may be null, gets 1
  // or the code of the last item that resisted.
  static void deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion);
  // Has the container taken out of sight when the request completes. Returns 1, 40 or the code of
  // the lookup.
  uint64_t deleteContainerWithContainerIdentity(const TSYContainerIdentity& identity,
                                                bool transient);
  // The wipe: puts an empty container in the place of a per-user one, which keeps its identity and
  // UUID. From then on the connection may look up any identifier. Returns 1, 11 for another class
  // and for one that the caller may not wipe, 55, or a code of lookup, creation or replace.
  uint64_t deleteDataContainerContentWithContainerIdentity(const TSYContainerIdentity& identity);

  // --- Replace -----------------------------------------------------------------------------------

  // Puts the container `replacement` where `old` is, whose content goes to death row; with a plain
  // `old`, which names no container, makes it a regular one. With preserveOldUUID it takes the old
  // directory and UUID. Survives a crash at any point: the old or the new container is there then,
  // whole. Returns 1, or 11, 23, 76, 21, 22, 10, 27, 33, 34, 14, 46, 15, 45, 36, 40, or a code of
  // the cache or the metadata file. After a failure both are where they were, unless the code
  // is 36.
  uint64_t replaceContainerIdentity(const TSYContainerIdentity& old,
                                    const TSYConcreteContainerIdentity& replacement,
                                    bool preserveOldUUID, bool startDeletionThread);

  // --- Info values and queries -------------------------------------------------------------------
  // Each fails with code 21 when the very container is not there.

  // Sets a value of the container's info dictionary; none removes the key. Codes 38 without a key,
  // 34, 45.
  TSYResult<void> setInfoValue(const std::optional<platform::Value>& value,
                               const std::optional<std::string>& key,
                               const TSYConcreteContainerIdentity& identity, bool useLocking);
  // Codes 38 without a key, 24 (not logged) without a value.
  TSYResult<platform::Value> infoValueForKey(const std::optional<std::string>& key,
                                             const TSYConcreteContainerIdentity& identity,
                                             bool useLocking);
  TSYResult<TSYMetadataRef> metadataWithContainerIdentity(
      const TSYConcreteContainerIdentity& identity);
  // Makes the directories anew that every container of the class has, and touches nothing else.
  TSYResult<void> recreateDefaultStructureWithContainerIdentity(
      const TSYConcreteContainerIdentity& identity);
  // Gives the directory a new name; the container's UUID stays. Codes 11 for one whose name is no
  // UUID, 48, 45, 40.
  TSYResult<void> regenerateDirectoryUUIDWithContainerIdentity(
      const TSYConcreteContainerIdentity& identity);
  // Bytes. A bundle is measured once and the size remembered in its info dictionary. Code 40.
  TSYResult<uint64_t> diskUsageWithContainerIdentity(const TSYConcreteContainerIdentity& identity);
  // The groups of an owner, by group identifier, made where they are missing. Codes 55, 40.
  using GroupContainers = std::map<std::string, TSYMetadataRef>;
  TSYResult<GroupContainers> groupContainersForOwnerIdentifier(
      const std::string& ownerIdentifier, const TSYUserIdentityRef& userIdentity,
      TSYContainerClass groupContainerClass);

  // --- User-managed assets and staged shared content ---------------------------------------------
  // Paths that a client gives are relative, and nothing outside the container's own directory is
  // reached through them, whatever its owner does to it meanwhile.

  struct UserManagedAssets {
    std::string path;
    bool existed;
  };
  // The directory in which a client keeps content that its user manages, absolute or relative to
  // the container. Codes 38 for another's container without the entitlement, 11, 71 (not logged)
  // when there is none and none is to be made, 41 when that cannot be told, 6, 45, 40 and those of
  // the metadata file.
  TSYResult<UserManagedAssets> userManagedAssetsPathWithContainerIdentity(
      const TSYContainerIdentity& identity, bool isRelative, bool createIfNecessary);
  // Moves one item of that directory to death row. `relativePath` is relative to it. Codes 11, 10
  // for what is not inside it, 41, 40. Returns 1 or the code.
  uint64_t deleteUserManagedAssetWithContainerIdentity(
      const TSYContainerIdentity& identity, const std::optional<std::string>& relativePath);
  // Moves an item within a system group container that the caller is entitled to, with its
  // access-control lists standardised; both paths are relative to the container. Returns where the
  // item is now. Codes 18 without an identifier, 11, 38, 55, 21, 10, 63, 64, 40.
  TSYResult<TSYURL> stageSharedContentForIdentifier(
      const std::optional<std::string>& identifier,
      const std::optional<std::string>& sourceRelativePath,
      const std::optional<std::string>& destRelativePath);

  // --- Boot --------------------------------------------------------------------------------------

  // Run at every start, before any request is served: repairs replaces that were cut short.
  void tessarySetup();
  // Run at every start: throws away what is left in the staging directories and empties death row,
  // in the background. The completion, which may be null, gets the code of the emptying.
  void tessaryCleanupWithCompletion(std::function<void(uint64_t)> completion);
  // Run at the first start after a boot: throws away transient containers and, in the background,
  // what lies in a class directory and is no container. Death row is not emptied.
  void rebootTessaryCleanupWithCompletion(std::function<void()> completion);

 private:
  using IdentifierSet = std::set<std::string, std::less<>>;

  TSYResult<void> checkAccess(const TSYContainerIdentity& identity);
  bool mayLookUp(const TSYContainerIdentity& identity);
  // The part of the rule that holds for a container and for the owner of groups.
  bool mayLookUpOf(TSYContainerClass containerClass, const std::string& identifier);
  bool mayLookUpSystemContainer(const TSYContainerIdentity& identity);
  const IdentifierSet* _lookupForContainerClass(TSYContainerClass containerClass);

  TSYResult<TSYMetadataRef> createOrLookup(const std::optional<TSYContainerIdentity>& identity,
                                           bool createIfNecessary, bool transient, bool useLocking);
  TSYResult<TSYMetadataRef> createContainer(const TSYContainerIdentity& identity, bool transient);
  TSYResult<void> removeTransientContainer(const TSYMetadata& container);
  TSYResult<TSYMetadata> buildInStaging(const TSYContainerIdentity& identity,
                                        const TSYURL& stagingURL);
  TSYResult<void> fillStaging(const TSYMetadata& metadata, const TSYURL& stagingURL);
  TSYResult<TSYURL> moveIntoPlace(const TSYContainerIdentity& identity, bool transient,
                                  const TSYURL& stagingURL);
  TSYResult<TSYMetadataRef> enterIntoCache(TSYMetadata metadata, const TSYURL& liveURL,
                                           bool transient);
  TSYResult<void> _createTopLevelContainerDirectory(const TSYURL& url,
                                                    TSYContainerClass containerClass, uid_t owner);
  TSYResult<void> _createSubDirectories(const TSYURL& containerURL,
                                        const TSYMetadata& containerMetadata);
  int _dataProtectionClassForContainerMetadata(const TSYMetadata& metadata);

  void sentence(const TSYURL& url, std::string_view kind);
  void sentenceTransientContainers();
  void queueOrphanCleanup(const TSYUserIdentityRef& userIdentity, TSYContainerClass containerClass);
  static void _cleanupOprhanedCodeSigningMappingData();
  void _cleanupOrphanedDataForDirectories(const std::optional<std::vector<TSYURL>>& directories,
                                          TSYContainerClass containerClass);

  bool mayWipe(const TSYContainerIdentity& identity) const;
  uint64_t wipe(const TSYContainerIdentity& identity);

  // Where the containers of a replace are, as its journal has it.
  struct ReplaceURLs {
    TSYURL old;
    TSYURL replacement;
    TSYURL staging;
    TSYURL destination;
  };
  TSYResult<void> replace(const TSYContainerIdentity& old,
                          const TSYConcreteContainerIdentity& replacement, bool preserveOldUUID,
                          bool startDeletionThread);
  TSYResult<void> replaceJournalled(const TSYMetadataRef& old, const TSYMetadataRef& replacement,
                                    const TSYURL& destination, bool preserveOldUUID,
                                    bool startDeletionThread);
  static platform::Value::Dictionary dictionaryOf(const ReplaceURLs& urls);
  static TSYResult<void> _writeToDiskReplaceAt(const TSYURL& journal, const ReplaceURLs& urls);
  static TSYResult<ReplaceURLs> _readAndValidateReplaceFileAtUrl(const TSYURL& journal);
  static TSYResult<void> _recoverFromReplaceOperations();
  static TSYResult<void> recoverFromReplaceOperation(const TSYURL& journal);
  static TSYResult<void> repairReplace(const ReplaceURLs& urls);

  TSYResult<void> checkGroupAccess(const std::string& ownerIdentifier,
                                   TSYContainerClass groupContainerClass);
  TSYResult<void> regenerateDirectoryUUID(const TSYConcreteContainerIdentity& identity);
  TSYResult<uint64_t> diskUsage(const TSYConcreteContainerIdentity& identity);
  void _regenerateAllSystemContainerPaths();

  TSYResult<UserManagedAssets> userManagedAssetsPath(const TSYContainerIdentity& identity,
                                                     bool isRelative, bool createIfNecessary);
  TSYResult<void> deleteUserManagedAsset(const TSYContainerIdentity& identity,
                                         const std::optional<std::string>& relativePath);
  TSYResult<TSYURL> stageSharedContent(const std::optional<std::string>& identifier,
                                       const std::optional<std::string>& sourceRelativePath,
                                       const std::optional<std::string>& destRelativePath);
  bool isMemberOfSystemGroup(const std::string& group) const;

  static uint64_t emptyDeathRow();
  static TSYResult<void> _removeItemOrMoveToTempAtURL(const TSYURL& url);

  const TSYClientIdentityRef clientIdentity_;
  const bool entitled_;
  bool allowOtherIdLookup_;
  bool allowGroupIdLookup_ = false;
  bool unrestricted_;
  const Lookup lookup_;
  const WipeIdentifiers entitledWipeIdentifiers_;
  const std::shared_ptr<TSYCommandQueue> commandQueue_;
  TSYUserIdentityCache& userIdentityCache_;

  platform::Mutex lookupLock_;
  // By class key, built from lookup_ when a class is first asked for, and never changed then.
  std::map<std::string, IdentifierSet, std::less<>> sanitizedLookup_ GUARDED_BY(lookupLock_);
};

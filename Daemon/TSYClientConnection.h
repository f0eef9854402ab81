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
  void setAllowOtherIdLookup(bool allow) { allowOtherIdLookup_ = allow; }
  void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }
  void setUnrestricted(bool unrestricted) { unrestricted_ = unrestricted; }

  // Runs what the operations have deferred. The dispatcher calls it after every handler.
  TSYResult<void> complete();

  // Whether the entitlements name this identifier for this class.
  bool isEntitledForLookupWithClass(TSYContainerClass containerClass,
                                    const std::string& identifier);

  // --- Create or look up
  // --------------------------------------------------------------------------

  // Finds the container, or creates it: built in a staging directory and moved into place whole.
  // existed() of the result tells which. A transient container is never reused: a second creation
  // replaces it. With useLocking NO the caller holds the identifier locks.
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

  // --- Deletion
  // -----------------------------------------------------------------------------------

  // Takes an item out of sight: moves it into a new directory on death row. A missing item is
  // success. Code 41.
  TSYResult<void> _moveItemAtURLToDeathRow(const TSYURL& url, bool startDeletionThread);
  // Empties death row on its queue and returns at once. The completion, which may be null, gets 1
  // or the code of the last item that resisted.
  void deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion);

  // --- Boot
  // ---------------------------------------------------------------------------------------

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
  void _cleanupOrphanedDataForDirectories(const std::optional<std::vector<TSYURL>>& directories,
                                          TSYContainerClass containerClass);

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

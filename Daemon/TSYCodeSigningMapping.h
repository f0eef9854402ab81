// What every installed application and plug-in is entitled to.
//
// The installer registers the code-signing information of each identifier, above all its
// entitlements; so does, for lack of that, a caller's own first request. The mapping keeps it in a
// database, ties plug-ins to their application, and whenever entitlements change works out which
// group and system containers have lost their last reference: their deletion goes on the command
// queue of the request.
//
// All work on the database runs on one serial queue, onto which the public operations hop;
// _onQueue_ ones run there. Entries that were read stay in memory, bounded.
//
// Nothing on the queue asks the container cache, which itself asks the mapping, for a parent, under
// its lock. Off the queue all that need entitlements may ask it, so they are not called under its
// lock.
//
// All operations may be called from any thread, but not on the queue. Where said so they take the
// global write lock; their caller then holds no identifier lock.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Daemon/TSYCodeSigningEntry.h"
#include "Daemon/TSYCodeSigningEntryCache.h"
#include "Daemon/TSYError.h"
#include "Daemon/TSYSQLiteDB.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Platform/base/SerialQueue.h"
#include "Platform/values/Value.h"

class TSYCommandQueue;

// Whose groups: those of applications, each user's own, or the system's.
enum class TSYGroupType : int64_t { application = 0, system = 1 };

class TSYCodeSigningMapping {
 public:
  using Info = TSYCodeSigningEntry::Info;
  using Entitlements = std::shared_ptr<const platform::Value::Dictionary>;
  using Identifiers = std::optional<std::vector<std::string>>;
  // For each group the number of entries that name it.
  using ReferenceCounts = std::map<std::string, int64_t, std::less<>>;

  // Opens the database of the process; one that cannot be opened ends it.
  static TSYCodeSigningMapping& sharedInstance();
  TSYCodeSigningMapping(TSYUserIdentityCache& userIdentityCache,
                        std::unique_ptr<TSYSQLiteDB> codeSigningMappingDB);

  // --- Registering -------------------------------------------------------------------------------

  // Takes the place of what was registered for the identifier; null information forgets it. An
  // entry that cannot be written is logged, and the answer is 1. Returns 1, or 18 without an
  // identifier, 66, 40.
  uint64_t processCodeSigningInfo(const Info& info, const std::optional<std::string>& identifier,
                                  const platform::Value::Dictionary& options,
                                  TSYCommandQueue& commandQueue);
  // Registers what a caller of the daemon is entitled to, unless the installer has registered him
  // or nothing has changed. Takes the global write lock when there is something to register.
  // Returns 1, or 38 for what has no property-list form, 66, 40.
  uint64_t processCallerRegisteredEntitlements(const platform::Value::Dictionary& entitlements,
                                               const std::string& identifier,
                                               TSYCommandQueue& commandQueue);
  // Forgets an application and the plug-ins under it. Failures are logged.
  void removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                TSYCommandQueue& commandQueue);
  // Marks entries as out of date. An unknown identifier is success. Codes 66, 40.
  TSYResult<void> invalidateCodeSigningInfoForIdentifier(const std::string& identifier);
  TSYResult<void> invalidateCodeSigningInfoForIdentifierAndItsChildren(
      const std::string& identifier);
  // Invalidates what the installer has registered and no bundle container is there for. Takes the
  // global write lock. Returns 1, also when the identifiers cannot be listed (logged), or 66 when
  // one of them could not be invalidated.
  uint64_t invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  TSYResult<void> removeAllAdvanceCopies();
  // After an update of the system: takes over what older releases kept elsewhere and removes the
  // group containers that nobody names. Takes the global write lock. The removals are done when it
  // returns.
  void performAllCodeSigningMigrationAndReconciliation();

  // --- Asking ------------------------------------------------------------------------------------
  // An entry that cannot be read counts as none, unless a code is named.

  // What a client may be told: nothing of a placeholder, an advance copy or an invalid entry. Takes
  // the global write lock. Null when there is none.
  Info getCodeSigningInfoForIdentifier(const std::string& identifier);
  // Null when none are recorded. Those that an older installer has left with the application's
  // bundle container are taken over.
  Entitlements entitlementsForIdentifier(const std::string& identifier);
  // The groups that the entitlements name; none when they name none, or not as a list of strings.
  Identifiers appGroupIdentifiersForIdentifier(const std::string& identifier);
  Identifiers systemGroupIdentifiersForIdentifier(const std::string& identifier);
  bool identifierHasSystemContainer(const std::string& identifier);
  // The class of the identifier's data container; 0 when none is recorded.
  uint64_t dataContainerTypeForIdentifier(const std::string& identifier);
  bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);
  // Null when there is none. Code 66.
  TSYResult<TSYCodeSigningEntryRef> codeSigningEntryForIdentifier(const std::string& identifier);
  Identifiers childBundleIdentifiersForParentIdentifier(const std::string& identifier);
  // The application that a plug-in belongs to.
  std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& identifier);
  TSYResult<std::vector<std::string>> identifiers();
  // None when not every entry could be read: a group whose references are not known for certain
  // must not be taken for one without.
  std::optional<ReferenceCounts> copyReferenceCountSetOfType(TSYGroupType type);

  // For the end of the process: the write-ahead log goes into the database file, and the queue
  // stands still. Who asks from then on waits for ever.
  void close();

  // Whether the calling thread is on the queue.
  bool isOnQueue() const { return queue_.isCurrent(); }

  // --- What older releases kept elsewhere --------------------------------------------------------
  // Both are called under the global write lock.

  void migrateAppGroupIdsFromDataContainersToFile();
  void migrateCachedCodeSigningInfoFromBundleContainersToMapping();

 private:
  // An entry to write, and whose it is.
  using Write = std::pair<std::string, TSYCodeSigningEntry>;
  using Writes = std::vector<Write>;

  static std::unique_ptr<TSYCodeSigningMapping> openShared();

  // Runs `work` on the queue.
  template <typename Work>
  std::invoke_result_t<Work> onQueue(Work&& work) {
    return queue_.sync(std::forward<Work>(work));
  }
  // Runs a change of the database. What was read before it is forgotten, whatever comes of it.
  template <typename Change>
  std::invoke_result_t<Change, TSYSQLiteDB&> _onQueue_change(Change&& change) REQUIRES(queue_) {
    struct Forgetting {
      TSYCodeSigningEntryCache& entries;
      ~Forgetting() { entries.clear(); }
    };
    const Forgetting forgetting{entries_};
    return std::forward<Change>(change)(*codeSigningMappingDB_);
  }

  // Entitlements.
  static Identifiers _copyApplicationGroupEntitlementForIdentifier(const std::string& identifier,
                                                                   const Entitlements& entitlements,
                                                                   const char* groupKey);
  static Identifiers _appGroupIdentifiersForIdentifier(const std::string& identifier,
                                                       const Entitlements& entitlements);
  static Identifiers _systemGroupIdentifiersForIdentifier(const std::string& identifier,
                                                          const Entitlements& entitlements);
  // The same with groups of any name.
  static Identifiers allSystemGroupIdentifiers(const std::string& identifier,
                                               const Entitlements& entitlements);
  static bool _entitlementsHasSystemContainer(const Entitlements& entitlements);
  static Info _codeSigningInfoForCodeSigningEntry(const TSYCodeSigningEntryRef& entry,
                                                  bool externalRequest);
  static Entitlements _entitlementsFromInfo(const Info& info);
  static Entitlements _entitlementsFromCodeSigningEntry(const TSYCodeSigningEntryRef& entry);

  // Reading.
  TSYResult<TSYCodeSigningEntryRef> _onQueue_codeSigningEntryForIdentifier(
      const std::string& identifier) REQUIRES(queue_);
  Info _onQueue_codeSigningInfoForIdentifier(const std::string& identifier, bool externalRequest)
      REQUIRES(queue_);
  Identifiers _onQueue_childBundleIdentifiersForParentIdentifier(const std::string& identifier)
      REQUIRES(queue_);
  std::optional<std::string> _onQueue_parentIdentifierForChildIdentifier(
      const std::string& identifier) REQUIRES(queue_);
  std::optional<ReferenceCounts> _onQueue_copyReferenceCountSetOfType(TSYGroupType type)
      REQUIRES(queue_);
  static void addReferences(ReferenceCounts& counts, TSYGroupType type,
                            const std::string& identifier, const TSYCodeSigningEntry& entry);

  // Registering.
  uint64_t _onQueue_processCodeSigningInfo(const Info& info, const std::string& identifier,
                                           const platform::Value::Dictionary& options,
                                           TSYCommandQueue& commandQueue) REQUIRES(queue_);
  TSYResult<void> _onQueue_register(const Info& info, const std::string& identifier,
                                    const platform::Value::Dictionary& options,
                                    TSYCommandQueue& commandQueue) REQUIRES(queue_);
  TSYResult<void> _onQueue_stageChild(const std::string& parent, const std::string& identifier,
                                      Writes& writes) REQUIRES(queue_);
  // What the change of an identifier's entitlements leaves without a reference.
  void _onQueue_reconcile(const std::string& identifier, const Entitlements& oldEntitlements,
                          const Entitlements& newEntitlements, TSYCommandQueue& commandQueue)
      REQUIRES(queue_);
  void queueDeletionOfSystemContainer(const std::string& identifier, TSYCommandQueue& commandQueue);
  void _onQueue_handleChangeFromOldGroupContainerIds(const Identifiers& oldIds,
                                                     const Identifiers& newIds, TSYGroupType type,
                                                     TSYCommandQueue& commandQueue)
      REQUIRES(queue_);
  void _onQueue_removeReferenceForGroupIdentifiers(const std::vector<std::string>& identifiers,
                                                   TSYGroupType type, TSYCommandQueue& commandQueue)
      REQUIRES(queue_);
  void _onQueue_removeGroupContainersIfNeededforUserIdentity(
      const TSYUserIdentityRef& userIdentity, TSYContainerClass groupContainerClass,
      const std::vector<std::string>& identifiers, const ReferenceCounts& referenceCounts,
      TSYCommandQueue& commandQueue) REQUIRES(queue_);
  void queueDeletionOfGroupContainer(const TSYUserIdentityRef& userIdentity,
                                     const std::string& group,
                                     TSYContainerClass groupContainerClass,
                                     TSYCommandQueue& commandQueue);
  void _onQueue_setCodeSigningDictionaryValues(const Writes& writes) REQUIRES(queue_);
  void _onQueue_write(const std::string& identifier, const TSYCodeSigningEntry& entry)
      REQUIRES(queue_);
  bool isReferenced(const std::string& group);

  TSYResult<void> _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(
      const std::string& identifier) REQUIRES(queue_);
  TSYResult<void> invalidateUnlessBundled(const std::string& identifier);
  Entitlements takeOverFromBundleContainer(const std::string& identifier);

  // What older releases kept elsewhere.
  void _onQueue_migrateFromMappingFileToDBIfNecessary() REQUIRES(queue_);
  void _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() REQUIRES(queue_);

  TSYUserIdentityCache& userIdentityCache_;
  mutable platform::SerialQueue queue_{"com.veltra.Tessary.EntitlementQueue"};
  const std::unique_ptr<TSYSQLiteDB> codeSigningMappingDB_ PT_GUARDED_BY(queue_);
  TSYCodeSigningEntryCache entries_;
};

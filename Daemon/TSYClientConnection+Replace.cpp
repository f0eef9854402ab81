// Replacing one container by another, so that a crash at any point leaves the old or the new one.
//
// A journal with the four paths is on disk before anything moves. Then the old container goes into
// a staging directory that the journal names, and the new one to the destination, each with one
// rename. So at every point one of three holds: the old path is occupied (nothing has moved, or all
// is done), the destination is occupied (done), or both are empty and the old container is in
// staging, from where the next start puts it back. What fails in between is undone at once.

#include <cstdlib>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYPropertyList.h"
#include "Platform/os/Platform.h"

using platform::UUID;
using platform::Value;

namespace {

constexpr char kOldURLKey[] = "TSYReplaceOperationOldURL";
constexpr char kNewURLKey[] = "TSYReplaceOperationNewURL";
constexpr char kStagingURLKey[] = "TSYReplaceOperationStagingURL";
constexpr char kDestinationURLKey[] = "TSYReplaceOperationDestURL";

TSYFileManager& fileManager() {
  return TSYFileManager::defaultManager();
}

TSYResult<TSYMetadataRef> find(const TSYConcreteContainerIdentity& identity) {
  TSYMetadataRef container =
      TSYContainerCache::sharedInstance().containerForContainerIdentity(identity);
  if (container) return container;
  return TSYFailure(TSYErrorCreate(TSYErrorNotFound, std::nullopt, TSYLogIt::yes,
                                   "No Container with identity: {}", identity.description()));
}

TSYResult<void> dropFromCache(const TSYMetadata& container) {
  const auto removed = TSYContainerCache::sharedInstance().removeContainerForUserIdentity(
      container.userIdentity(), container.containerClass(), container.identifier(),
      container.transient());
  if (removed) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorCacheRemoveFailed, removed.error(), TSYLogIt::yes,
                                   "Failed to remove from cache id: {}, class: {}, transient: {:d}",
                                   container.identifier(), container.containerClass(),
                                   container.transient()));
}

TSYResult<void> enterIntoCache(const TSYMetadata& container, const TSYURL& url, bool transient) {
  const auto added = TSYContainerCache::sharedInstance().addContainerMetadata(
      container, url, transient, /*updateSandbox=*/true);
  if (added) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorCacheAddFailed, added.error(), TSYLogIt::yes,
                                   "Failed to add to cache: {}, url: {}, transient: {:d}",
                                   container.description(), url.path(), transient));
}

// What has been renamed into a directory stays there after a power cut.
TSYResult<void> syncDirectoryOf(const TSYURL& item) {
  const TSYURL directory = item.deletingLastPathComponent();
  const auto synced = platform::Platform::current().files.syncDirectory(directory.path());
  if (synced) return {};
  return TSYFailure(TSYPosixErrorCreate(synced.error(), "fsync of {} failed: {}", directory.path(),
                                        synced.error().message()));
}

// The two containers of a replace while they change places. Unless run() succeeds, undo() puts them
// back; an exception does so too, and ends the process when it cannot: the journal is there then.
class Exchange {
 public:
  // `old` is null when the new container only becomes a regular one. With `uuidToKeep` the new one
  // gets that UUID before it is seen at the destination.
  Exchange(TSYMetadataRef old, TSYMetadataRef replacement, std::optional<UUID> uuidToKeep,
           TSYURL staging, TSYURL destination)
      : old_(std::move(old)),
        replacement_(std::move(replacement)),
        uuidToKeep_(uuidToKeep),
        staging_(std::move(staging)),
        destination_(std::move(destination)) {}
  ~Exchange() {
    if (!over_ && !undo()) std::abort();
  }
  Exchange(const Exchange&) = delete;
  Exchange& operator=(const Exchange&) = delete;

  TSYResult<void> run() {
    if (old_) {
      if (auto aside = takeOldAside(); !aside) return aside;
    }
    if (auto inPlace = putReplacementInPlace(); !inPlace) return inPlace;
    over_ = true;
    return {};
  }

  // Returns whether the old container is where it was: if not, it is in staging.
  bool undo() {
    over_ = true;
    if (isReplacementMoved_) takeReplacementBack();
    if (isUUIDWritten_ && !replacement_->writeMetadataToDisk()) {
      TSYLogWrite(TSYLogLevelError, "Failed to give {} its UUID back", replacement_->url().path());
    }
    const bool isOldBack = !isOldStaged_ || putOldBack();
    if (isOldDropped_ && isOldBack) {
      (void)enterIntoCache(*old_, old_->url(), old_->transient());
    }
    if (isReplacementDropped_ && fileManager().itemExistsAtURL(replacement_->url())) {
      (void)enterIntoCache(*replacement_, replacement_->url(), replacement_->transient());
    }
    return isOldBack;
  }

 private:
  TSYResult<void> takeOldAside() {
    const auto moved = fileManager().moveItemAtURL(old_->url(), staging_);
    if (!moved) {
      return TSYFailure(TSYErrorCreate(TSYErrorReplaceStageOldFailed, moved.error(), TSYLogIt::yes,
                                       "Failed to move old {} to staging {}", old_->url().path(),
                                       staging_.path()));
    }
    isOldStaged_ = true;
    if (auto dropped = dropFromCache(*old_); !dropped) return dropped;
    isOldDropped_ = true;
    if (!TSYIsBundleClass(old_->containerClass())) return {};
    auto invalidated =
        TSYCodeSigningMapping::sharedInstance()
            .invalidateCodeSigningInfoForIdentifierAndItsChildren(old_->identifier());
    if (!invalidated) {
      TSYLogWrite(TSYLogLevelError, "Failed to invalidate code signing info for {}",
                  old_->identifier());
    }
    return invalidated;
  }

  TSYResult<void> putReplacementInPlace() {
    TSYMetadata metadata = *replacement_;
    if (uuidToKeep_) {
      metadata.setUUID(*uuidToKeep_);
      isUUIDWritten_ = true;
      if (auto written = metadata.writeMetadataToDisk(); !written) return written;
    }
    if (auto moved = moveReplacement(); !moved) return moved;
    if (auto dropped = dropFromCache(*replacement_); !dropped) return dropped;
    isReplacementDropped_ = true;
    return enterIntoCache(metadata, destination_, old_ && old_->transient());
  }

  TSYResult<void> moveReplacement() {
    auto moved = fileManager().moveItemAtURL(replacement_->url(), destination_);
    isReplacementMoved_ = moved.has_value();
    if (moved) moved = syncDirectoryOf(destination_);
    if (moved) return {};
    return TSYFailure(TSYErrorCreate(TSYErrorReplaceFailed, moved.error(), TSYLogIt::yes,
                                     "Failed to replace: {} with: {} at: {}",
                                     old_ ? old_->url().path() : "(null)",
                                     replacement_->url().path(), destination_.path()));
  }

  // The destination must be free for the old container, if need be at the cost of the new one.
  void takeReplacementBack() {
    const auto moved = fileManager().moveItemAtURL(destination_, replacement_->url());
    if (moved) return;
    TSYLogWrite(TSYLogLevelError, "Failed to move {} back to {}: {}", destination_.path(),
                replacement_->url().path(), moved.error());
    isUUIDWritten_ = false;
    (void)TSYClientConnection::_moveItemAtURLToDeathRow(destination_,
                                                        /*startDeletionThread=*/false);
  }

  bool putOldBack() {
    TSYLogWrite(TSYLogLevelDebug, "Recovering from failed replace by moving: {} to {}",
                staging_.path(), old_->url().path());
    const auto moved = fileManager().moveItemAtURL(staging_, old_->url());
    if (moved) return true;
    (void)TSYErrorCreate(TSYErrorReplaceFileInvalid, moved.error(), TSYLogIt::yes,
                         "Failed to recover replace move: {} to {}", staging_.path(),
                         old_->url().path());
    return false;
  }

  const TSYMetadataRef old_;
  const TSYMetadataRef replacement_;
  const std::optional<UUID> uuidToKeep_;
  const TSYURL staging_;
  const TSYURL destination_;

  // How far it has come.
  bool isOldStaged_ = false;
  bool isOldDropped_ = false;
  bool isUUIDWritten_ = false;
  bool isReplacementMoved_ = false;
  bool isReplacementDropped_ = false;
  bool over_ = false;
};

TSYResult<void> checkReplace(const TSYConcreteContainerIdentity* old,
                             const TSYConcreteContainerIdentity& replacement,
                             bool preserveOldUUID) {
  if (old == nullptr) {
    if (!preserveOldUUID) return {};
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Can't have a nil oldContainerUUID when preserving the UUID"));
  }
  if (old->containerClass() != replacement.containerClass()) {
    return TSYFailure(TSYErrorCreate(TSYErrorClassMismatch, std::nullopt, TSYLogIt::yes,
                                     "Can't replace containers of different class types: {} and {}",
                                     old->containerClass(), replacement.containerClass()));
  }
  if (!old->userIdentity()->isEqualToUserIdentity(*replacement.userIdentity())) {
    return TSYFailure(TSYErrorCreate(TSYErrorPersonaMismatch, std::nullopt, TSYLogIt::yes,
                                     "Can't replace containers of different personas: {} and {}",
                                     old->userIdentity(), replacement.userIdentity()));
  }
  return {};
}

TSYResult<void> checkDirectories(const TSYMetadata* old, const TSYMetadata& replacement) {
  const TSYURL url = replacement.url();
  if (old != nullptr && old->url() == url) {
    return TSYFailure(TSYErrorCreate(TSYErrorSameContainer, std::nullopt, TSYLogIt::yes,
                                     "Can't replace the same container at {}", url.path()));
  }
  if (!UUID::parse(std::string(url.lastPathComponent()))) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidPath, std::nullopt, TSYLogIt::yes,
                                     "Invalid URL (last path component not UUID): {}", url.path()));
  }
  return {};
}

// Where a container goes that keeps its directory's name.
TSYResult<TSYURL> freeDestination(const TSYMetadata* old, const TSYMetadata& replacement) {
  const auto directory =
      TSYGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
          replacement.userIdentity(), replacement.containerClass(),
          old != nullptr && old->transient());
  if (!directory) {
    return TSYFailure(TSYErrorCreate(
        TSYErrorReplaceFailed, std::nullopt, TSYLogIt::yes, "Failed to replace: {} with: {} at: {}",
        old == nullptr ? "(null)" : old->url().path(), replacement.url().path(), "(null)"));
  }
  TSYURL destination = directory->appending(replacement.url().lastPathComponent());
  if (!fileManager().itemExistsAtURL(destination)) return destination;
  return TSYFailure(TSYErrorCreate(TSYErrorAlreadyExists, std::nullopt, TSYLogIt::yes,
                                   "Container already exists at {}", destination.path()));
}

// A container that becomes a regular one must be the only one of its name.
TSYResult<void> checkNoRegularContainer(const TSYConcreteContainerIdentity& identity) {
  const auto found = TSYContainerCache::sharedInstance().containerForContainerIdentity(
      static_cast<const TSYContainerIdentity&>(identity), /*transient=*/false,
      /*updateSandbox=*/true);
  if (found) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorAlreadyExists, std::nullopt, TSYLogIt::yes,
                       "Container with identifier: {}, class: {}, transient: {:d} already exists",
                       identity.identifier(), identity.containerClass(), false));
  }
  if (!found.error().is(TSYErrorNotFound)) return TSYFailure(found.error());
  return {};
}

// Runs it; what fails is undone.
TSYResult<void> promote(TSYMetadataRef replacement, TSYURL destination) {
  Exchange exchange(nullptr, std::move(replacement), std::nullopt, TSYURL(),
                    std::move(destination));
  auto result = exchange.run();
  if (!result) exchange.undo();
  return result;
}

// After a replace and one that was undone: what is left in staging is garbage.
TSYResult<void> discard(const TSYURL& staging, const TSYURL& journal, bool startDeletionThread) {
  auto moved =
      TSYClientConnection::_moveItemAtURLToDeathRow(staging, /*startDeletionThread=*/false);
  if (!moved) {
    // The journal stays: while it is there nobody takes the staging directory for a leftover.
    return TSYFailure(TSYErrorCreate(TSYErrorRemoveFileFailed, moved.error(), TSYLogIt::yes,
                                     "Failed to remove staging dir: {}", staging.path()));
  }
  moved = TSYClientConnection::_moveItemAtURLToDeathRow(journal, startDeletionThread);
  if (moved) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorRemoveFileFailed, moved.error(), TSYLogIt::yes,
                                   "Failed to remove replace file: {}", journal.path()));
}

}  // namespace

uint64_t TSYClientConnection::replaceContainerIdentity(
    const TSYContainerIdentity& old, const TSYConcreteContainerIdentity& replacement,
    bool preserveOldUUID, bool startDeletionThread) {
  const auto replaced = TSYCatchingExceptionsUnlessInternal(
      TSYGlobalConfiguration::sharedInstance().isInternalImage(),
      [&] { return replace(old, replacement, preserveOldUUID, startDeletionThread); });
  return replaced ? uint64_t{TSYErrorSuccess} : replaced.error().clientCode();
}

TSYResult<void> TSYClientConnection::replace(const TSYContainerIdentity& old,
                                             const TSYConcreteContainerIdentity& replacement,
                                             bool preserveOldUUID, bool startDeletionThread) {
  const auto* concreteOld = TSYConcreteContainerIdentity::orNull(old);
  if (auto valid = checkReplace(concreteOld, replacement, preserveOldUUID); !valid) return valid;
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
  TSYMetadataRef oldContainer;
  if (concreteOld != nullptr) {
    auto found = find(*concreteOld);
    if (!found) return TSYFailure(std::move(found.error()));
    oldContainer = std::move(*found);
  }
  const auto newContainer = find(replacement);
  if (!newContainer) return TSYFailure(newContainer.error());
  if (auto valid = checkDirectories(oldContainer.get(), **newContainer); !valid) return valid;
  const auto destination = preserveOldUUID ? TSYResult<TSYURL>(oldContainer->url())
                                           : freeDestination(oldContainer.get(), **newContainer);
  if (!destination) return TSYFailure(destination.error());
  if (!oldContainer) {
    if (auto valid = checkNoRegularContainer(replacement); !valid) return valid;
    return promote(*newContainer, *destination);
  }
  return replaceJournalled(oldContainer, *newContainer, *destination, preserveOldUUID,
                           startDeletionThread);
}

TSYResult<void> TSYClientConnection::replaceJournalled(const TSYMetadataRef& old,
                                                       const TSYMetadataRef& replacement,
                                                       const TSYURL& destination,
                                                       bool preserveOldUUID,
                                                       bool startDeletionThread) {
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  const std::string operation = UUID::random().string();
  const TSYURL journal = configuration.replaceDirectory().appending(operation + ".plist");
  const auto stagingDirectory = configuration.stagingDirectoryURLForUserIdentity(
      replacement->userIdentity(), replacement->containerClass());
  const TSYURL staging = stagingDirectory ? stagingDirectory->appending(operation) : TSYURL();

  auto result =
      _writeToDiskReplaceAt(journal, {old->url(), replacement->url(), staging, destination});
  if (result) {
    Exchange exchange(old, replacement, preserveOldUUID ? std::optional(old->uuid()) : std::nullopt,
                      staging, destination);
    result = exchange.run();
    // The old container is in staging still: the next start puts it back.
    if (!result && !exchange.undo()) return result;
  } else {
    TSYLogWrite(TSYLogLevelError, "Failed to write replace file: {}", journal.path());
  }
  auto discarded = discard(staging, journal, startDeletionThread);
  return result ? std::move(discarded) : std::move(result);
}

TSYResult<void> TSYClientConnection::_writeToDiskReplaceAt(const TSYURL& journal,
                                                           const ReplaceURLs& urls) {
  const auto& [old, replacement, staging, destination] = urls;
  for (const TSYURL& url : {old, replacement, staging, destination}) {
    if (!url.path().empty()) continue;
    return TSYFailure(
        TSYErrorCreate(TSYErrorInvalidReplaceInfo, std::nullopt, TSYLogIt::yes,
                       "Invalid Replace File Info: old: {}, new: {}, staging: {}, dest: {}",
                       old.path(), replacement.path(), staging.path(), destination.path()));
  }
  auto written = TSY_writeToURL({{kOldURLKey, old.path()},
                                 {kNewURLKey, replacement.path()},
                                 {kStagingURLKey, staging.path()},
                                 {kDestinationURLKey, destination.path()}},
                                journal, kTSYWriteAtomic | kTSYWriteProtectionNone);
  if (written) written = syncDirectoryOf(journal);
  if (written) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorWriteFailed, written.error(), TSYLogIt::yes,
                                   "Failed to write replace dictionary to URL {}", journal.path()));
}

TSYResult<TSYClientConnection::ReplaceURLs> TSYClientConnection::_readAndValidateReplaceFileAtUrl(
    const TSYURL& journal) {
  const auto dictionary = TSY_dictionaryWithContentsOfURL(journal);
  if (!dictionary) {
    return TSYFailure(TSYErrorCreate(TSYErrorReplaceFileInvalid, dictionary.error(), TSYLogIt::yes,
                                     "Failed to read replace file at URL {}", journal.path()));
  }
  std::vector<const Value*> found;
  std::vector<std::string> shown;
  for (const char* key : {kOldURLKey, kNewURLKey, kStagingURLKey, kDestinationURLKey}) {
    const auto place = dictionary->find(key);
    found.push_back(place == dictionary->end() ? nullptr : &place->second);
    shown.push_back(found.back() == nullptr ? "(null)" : found.back()->description());
  }
  std::vector<TSYURL> urls;
  for (const Value* value : found) {
    if (value != nullptr && value->asString() != nullptr) urls.emplace_back(*value->asString());
  }
  if (urls.size() != found.size()) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorReplaceFileInvalid, std::nullopt, TSYLogIt::yes,
                       "Invalid replace data: Old: {}, New: {}, Staging: {}, Dest: {}", shown[0],
                       shown[1], shown[2], shown[3]));
  }
  return ReplaceURLs{urls[0], urls[1], urls[2], urls[3]};
}

// One that cannot be repaired does not keep the others from it.
TSYResult<void> TSYClientConnection::_recoverFromReplaceOperations() {
  const TSYURL directory = TSYGlobalConfiguration::sharedInstance().replaceDirectory();
  const auto journals = fileManager().urlsForItemsInDirectoryAtURL(directory);
  if (!journals) {
    if (!journals.error().isPosix(ENOENT)) {
      TSYLogWrite(TSYLogLevelError, "Failed to get items at replace URL {} : {}", directory.path(),
                  journals.error());
    }
    return {};
  }
  TSYResult<void> result;
  for (const TSYURL& journal : *journals) {
    auto recovered = recoverFromReplaceOperation(journal);
    if (!recovered && result) result = std::move(recovered);
  }
  return result;
}

TSYResult<void> TSYClientConnection::recoverFromReplaceOperation(const TSYURL& journal) {
  const auto urls = _readAndValidateReplaceFileAtUrl(journal);
  if (urls) {
    const auto& [old, replacement, staging, destination] = *urls;
    TSYLogWrite(TSYLogLevelDebug, "Doing a replace of {} with info: {}, {}, {}, {}", journal.path(),
                old.path(), replacement.path(), staging.path(), destination.path());
    if (!fileManager().itemExistsAtURL(old) && !fileManager().itemExistsAtURL(destination)) {
      TSYLogWrite(TSYLogLevelDebug, "Recovering from failed replace by moving: {} to {}",
                  staging.path(), old.path());
      const auto moved = fileManager().moveItemAtURL(staging, old);
      if (!moved) {
        return TSYFailure(TSYErrorCreate(TSYErrorReplaceFileInvalid, moved.error(), TSYLogIt::yes,
                                         "Failed to recover replace move: {} to {}", staging.path(),
                                         old.path()));
      }
    }
  }
  const auto discarded = _moveItemAtURLToDeathRow(journal, /*startDeletionThread=*/false);
  if (discarded) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorRemoveFileFailed, discarded.error(), TSYLogIt::yes,
                                   "Failed to remove replace file at {}", journal.path()));
}

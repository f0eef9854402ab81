// Death row: what is to be deleted is renamed out of sight first and removed later, by one task at
// a time on a queue of its own. Nothing on death row is ever read back.
#include <sys/stat.h>

#include <algorithm>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCommandStageForDelete.h"
#include "Daemon/TSYDaemonQueues.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLog.h"

namespace {

// Death row is filled while it is emptied: a directory that was just made for an item may be
// removed before the item is in it, or be found empty and not be so any more. Both pass when it is
// tried anew, this often.
constexpr int kAttempts = 16;

// Moves the item into a new directory on death row: one of its own keeps items of the same name
// apart.
TSYResult<void> moveIntoOwnDirectory(const TSYURL& url) {
  TSYFileManager& files = TSYFileManager::defaultManager();
  const auto directory = files.createTemporaryDirectoryInDirectoryURL(
      TSYGlobalConfiguration::sharedInstance().deathrowDirectory());
  if (!directory) {
    return TSYFailure(TSYErrorCreate(TSYErrorFileOperationFailed, directory.error(), TSYLogIt::yes,
                                     "Failed to create unique directory at: {}", url.path()));
  }
  const TSYURL target = directory->appending(url.lastPathComponent());
  auto moved = files.renameItemAtURL(url, target);
  for (int attempt = 1; attempt < kAttempts; ++attempt) {
    if (moved || !moved.error().isPosix(ENOENT)) break;
    // What is gone already counts as deleted.
    if (files.itemDoesNotExistAtURL(url)) return {};
    (void)files.createDirectoryAtURL(*directory, /*withIntermediateDirectories=*/false, S_IRWXU);
    moved = files.renameItemAtURL(url, target);
  }
  if (moved || files.itemDoesNotExistAtURL(url)) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorFileOperationFailed, moved.error(), TSYLogIt::yes,
                                   "Failed to move item at: {} to: {}", url.path(), target.path()));
}

TSYResult<void> removeWhole(const TSYURL& url) {
  TSYFileManager& files = TSYFileManager::defaultManager();
  auto removed = files.removeItemAtURL(url);
  for (int attempt = 1; attempt < kAttempts; ++attempt) {
    if (removed || !removed.error().isPosix(ENOTEMPTY)) break;
    removed = files.removeItemAtURL(url);
  }
  return removed;
}

}  // namespace

TSYResult<void> TSYClientConnection::_moveItemAtURLToDeathRow(const TSYURL& url,
                                                              bool startDeletionThread) {
  auto moved = moveIntoOwnDirectory(url);
  if (moved && startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
  return moved;
}

void TSYClientConnection::deleteContainersOnDeathRowWithCompletion(
    std::function<void(uint64_t)> completion) {
  TSYAsyncKeepingAlive(TSYDeathRowQueue(), [completion = std::move(completion)] {
    const uint64_t code = emptyDeathRow();
    if (completion) completion(code);
  });
}

uint64_t TSYClientConnection::emptyDeathRow() {
  const TSYURL deathRow = TSYGlobalConfiguration::sharedInstance().deathrowDirectory();
  const auto items = TSYFileManager::defaultManager().urlsForItemsInDirectoryAtURL(deathRow);
  if (!items) {
    if (items.error().isPosix(ENOENT)) return TSYErrorSuccess;
    return TSYErrorCreate(TSYErrorDeleteFailed, items.error(), TSYLogIt::yes,
                          "Failed to get items for deletion: {} : {}", deathRow.path(),
                          items.error())
        .code();
  }
  uint64_t code = TSYErrorSuccess;
  for (const TSYURL& item : *items) {
    const auto removed = _removeItemOrMoveToTempAtURL(item);
    if (removed) continue;
    code = TSYErrorCreate(TSYErrorDestroyFailed, removed.error(), TSYLogIt::yes,
                          "Failed to destroy item at: {}", item.path())
               .code();
  }
  return code;
}

TSYResult<void> TSYClientConnection::_removeItemOrMoveToTempAtURL(const TSYURL& url) {
  const auto removed = removeWhole(url);
  if (removed || removed.error().isPosix(ENOENT)) return {};
  TSYLogWrite(TSYLogLevelDebug, "Couldn't remove, so moving item to /tmp: {} : {}", url.path(),
              removed.error());
  const TSYURL temporary = TSYGlobalConfiguration::sharedInstance().temporaryDirectory();
  const auto moved = TSYFileManager::defaultManager().renameItemAtURL(
      url, temporary.appending(url.lastPathComponent()));
  if (moved) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorMoveToTempFailed, moved.error(), TSYLogIt::yes,
                                   "Failed to move dir: {} to: {}", url.path(), temporary.path()));
}

uint64_t TSYClientConnection::deleteContainerWithContainerIdentity(
    const TSYContainerIdentity& identity, bool transient) {
  const auto deleted = TSYCatchingExceptions([&]() -> TSYResult<void> {
    const auto found = createOrLookupContainerWithContainerIdentity(
        identity, /*createIfNecessary=*/false, transient, /*useLocking=*/true);
    if (!found) {
      TSYLogWrite(TSYLogLevelError,
                  "Failed to lookup existing container to delete-identity: {}, transient: {:d}",
                  identity, transient);
      return TSYFailure(found.error());
    }
    commandQueue_->insertCommand(
        TSYCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            {std::make_shared<const TSYConcreteContainerIdentity>((*found)->containerIdentity())},
            /*useLocking=*/true, /*onError=*/nullptr));
    return {};
  });
  return deleted ? uint64_t{TSYErrorSuccess} : deleted.error().clientCode();
}

bool TSYClientConnection::mayWipe(const TSYContainerIdentity& identity) const {
  if (unrestricted_) return true;
  if (identity.containerClass() != kTSYContainerClassPluginData || !entitledWipeIdentifiers_) {
    return false;
  }
  return std::ranges::any_of(*entitledWipeIdentifiers_, [&](const platform::Value& entitled) {
    return entitled.asString() != nullptr && *entitled.asString() == identity.identifier();
  });
}

uint64_t TSYClientConnection::deleteDataContainerContentWithContainerIdentity(
    const TSYContainerIdentity& identity) {
  if (!TSYIsPerUserClass(identity.containerClass())) {
    TSYLogWrite(TSYLogLevelError,
                "Can't wipe container non-data container of type: {}, identifier: {}",
                identity.containerClass(), identity.identifier());
    return TSYErrorInvalidObject;
  }
  if (!mayWipe(identity)) {
    if (identity.containerClass() != kTSYContainerClassPluginData) {
      TSYLogWrite(TSYLogLevelError, "Can't wipe container with of type: {}, identifier: {}",
                  identity.containerClass(), identity.identifier());
      return TSYErrorInvalidObject;
    }
    TSYLogWrite(TSYLogLevelError, "Not entitled to wipe container with identifier: {}",
                identity.identifier());
    return TSYErrorNotEntitled;
  }
  const auto wiped = TSYCatchingExceptions([&]() -> TSYResult<uint64_t> { return wipe(identity); });
  return wiped ? *wiped : wiped.error().clientCode();
}

uint64_t TSYClientConnection::wipe(const TSYContainerIdentity& identity) {
  allowOtherIdLookup_ = true;
  const auto existing = createOrLookupContainerWithContainerIdentity(
      identity, /*createIfNecessary=*/false, /*transient=*/false, /*useLocking=*/true);
  if (!existing) {
    TSYLogWrite(TSYLogLevelError, "Failed to lookup existing container to wipe-identifier: {}",
                identity.identifier());
    return existing.error().clientCode();
  }
  const auto empty = createOrLookupContainerWithContainerIdentity(
      identity, /*createIfNecessary=*/true, /*transient=*/true, /*useLocking=*/true);
  if (!empty) {
    TSYLogWrite(TSYLogLevelError, "Failed to create transient container for wipe-identifier: {}",
                identity.identifier());
    return empty.error().clientCode();
  }
  const uint64_t code = replaceContainerIdentity(
      (*existing)->containerIdentity(), (*empty)->containerIdentity(), /*preserveOldUUID=*/true,
      /*startDeletionThread=*/true);
  if (code != TSYErrorSuccess) {
    TSYLogWrite(TSYLogLevelError, "Failed replace operation during delete all content");
  }
  return code;
}

#include "Daemon/TSYCommandStageForDelete.h"

#include "Daemon/TSYCacheSteps.h"
#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYLog.h"

namespace {

TSYMetadataRef find(const TSYContainerIdentity& identity) {
  TSYContainerCache& cache = TSYContainerCache::sharedInstance();
  if (const auto* concrete = TSYConcreteContainerIdentity::orNull(identity)) {
    return cache.containerForContainerIdentity(*concrete);
  }
  const auto found = cache.containerForContainerIdentity(identity, /*transient=*/false,
                                                         /*updateSandbox=*/true);
  return found ? *found : nullptr;
}

// Onto death row under its own name, or under one of its own when an earlier container of that name
// still lies there.
TSYResult<void> moveToDeathRow(const TSYURL& url, const TSYURL& target) {
  auto moved = TSYFileManager::defaultManager().renameItemAtURL(url, target);
  if (moved || !(moved.error().isPosix(ENOTEMPTY) || moved.error().isPosix(EEXIST))) return moved;
  return TSYClientConnection::_moveItemAtURLToDeathRow(url, /*startDeletionThread=*/false);
}

// Returns whether nothing is at the container's path any more.
bool takeOutOfSight(const TSYURL& url) {
  const TSYURL target = TSYGlobalConfiguration::sharedInstance().deathrowDirectory().appending(
      url.lastPathComponent());
  TSYFileManager& files = TSYFileManager::defaultManager();
  const auto moved = moveToDeathRow(url, target);
  // What is gone already counts as deleted.
  if (moved || files.itemDoesNotExistAtURL(url)) return true;
  TSYLogWrite(TSYLogLevelDebug, "Couldn't stage for deletion from {} to {}: {}", url.path(),
              target.path(), moved.error());
  const auto removed = files.removeItemAtURL(url);
  if (removed) return true;
  (void)TSYErrorCreate(TSYErrorDeleteFailed, std::nullopt, TSYLogIt::yes,
                       "Failed to delete container at {}: {}", url.path(), removed.error());
  return false;
}

TSYResult<void> stage(const TSYMetadata& container, TSYCommandQueue& queue) {
  if (TSYIsBundleClass(container.containerClass())) {
    TSYCodeSigningMapping::sharedInstance()
        .removeCodeSigningDictionariesForIdentifierAndItsChildren(container.identifier(), queue);
  }
  // A container that resists stays as it is, and is no failure of the command.
  if (!takeOutOfSight(container.url())) return {};
  return TSYRemoveFromCache(container);
}

}  // namespace

TSYCommandStageForDelete::TSYCommandStageForDelete(
    std::vector<TSYContainerIdentityRef> containerIdentities, bool useLocking, OnError onError,
    Condition isStillWanted)
    : containerIdentities_(std::move(containerIdentities)),
      useLocking_(useLocking),
      onError_(std::move(onError)),
      isStillWanted_(std::move(isStillWanted)) {}

std::shared_ptr<TSYCommandStageForDelete>
TSYCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
    std::vector<TSYContainerIdentityRef> containerIdentities, bool useLocking, OnError onError,
    Condition isStillWanted) {
  return std::make_shared<TSYCommandStageForDelete>(std::move(containerIdentities), useLocking,
                                                    std::move(onError), std::move(isStillWanted));
}

TSYResult<void> TSYCommandStageForDelete::fromQueueExecute(TSYCommandQueue& queue) {
  auto staged = TSYCatchingExceptions([&] { return stageAll(queue); });
  if (!staged && onError_) onError_(staged.error().clientCode());
  return staged;
}

TSYResult<void> TSYCommandStageForDelete::stageAll(TSYCommandQueue& queue) const {
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, useLocking_);
  if (isStillWanted_ && !isStillWanted_()) return {};
  for (const TSYContainerIdentityRef& identity : containerIdentities_) {
    const TSYMetadataRef container = find(*identity);
    if (!container) continue;
    if (auto staged = stage(*container, queue); !staged) return staged;
  }
  return {};
}

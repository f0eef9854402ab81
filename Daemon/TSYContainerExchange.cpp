#include "Daemon/TSYContainerExchange.h"

#include <cstdlib>

#include "Daemon/TSYCacheSteps.h"
#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYLog.h"

TSYContainerExchange::TSYContainerExchange(TSYMetadataRef old, TSYMetadataRef replacement,
                                           std::optional<platform::UUID> uuidToKeep, TSYURL staging,
                                           TSYURL destination)
    : old_(std::move(old)),
      replacement_(std::move(replacement)),
      uuidToKeep_(uuidToKeep),
      staging_(std::move(staging)),
      destination_(std::move(destination)) {}

TSYContainerExchange::~TSYContainerExchange() {
  if (over_) return;
  if (isOldStaged_) {
    TSYLogWrite(TSYLogLevelDebug, "Recovering from exception by moving: {} to {}", staging_.path(),
                old_->url().path());
  }
  if (!undo()) std::abort();
}

TSYResult<void> TSYContainerExchange::run() {
  if (old_) {
    if (auto aside = takeOldAside(); !aside) return aside;
  }
  if (auto inPlace = putReplacementInPlace(); !inPlace) return inPlace;
  over_ = true;
  return {};
}

bool TSYContainerExchange::undo() {
  over_ = true;
  if (isReplacementMoved_) takeReplacementBack();
  bool isUndone = !isUUIDWritten_ || restoreUUID();
  if (isOldStaged_) {
    const bool isOldBack = putOldBack();
    if (isOldBack && isOldDropped_) {
      (void)TSYAddToCache(*old_, old_->url(), old_->transient(), /*updateSandbox=*/true);
    }
    isUndone = isUndone && isOldBack && isOnDisk(old_->url());
  }
  return isUndone;
}

bool TSYContainerExchange::restoreUUID() {
  if (replacement_->writeMetadataToDisk()) return true;
  TSYLogWrite(TSYLogLevelError, "Failed to give {} its UUID back", replacement_->url().path());
  return false;
}

bool TSYContainerExchange::isOnDisk(const TSYURL& url) {
  const auto synced = TSYFileManager::defaultManager().syncDirectoryOfItemAtURL(url);
  if (synced) return true;
  TSYLogWrite(TSYLogLevelError, "{} may be lost with the power: {}", url.path(), synced.error());
  return false;
}

// One rename and never a copy: what is cut short then has done all of it or nothing.
TSYResult<void> TSYContainerExchange::takeOldAside() {
  const auto moved = TSYFileManager::defaultManager().renameItemAtURL(old_->url(), staging_);
  if (!moved) {
    return TSYFailure(TSYErrorCreate(TSYErrorReplaceStageOldFailed, moved.error(), TSYLogIt::yes,
                                     "Failed to move old {} to staging {}", old_->url().path(),
                                     staging_.path()));
  }
  isOldStaged_ = true;
  if (auto dropped = TSYRemoveFromCache(*old_); !dropped) return dropped;
  isOldDropped_ = true;
  if (!TSYIsBundleClass(old_->containerClass())) return {};
  auto invalidated =
      TSYCodeSigningMapping::sharedInstance().invalidateCodeSigningInfoForIdentifierAndItsChildren(
          old_->identifier());
  if (!invalidated) {
    TSYLogWrite(TSYLogLevelError, "Failed to invalidate code signing info for {}",
                old_->identifier());
  }
  return invalidated;
}

TSYResult<void> TSYContainerExchange::putReplacementInPlace() {
  TSYMetadata metadata = *replacement_;
  if (uuidToKeep_) {
    metadata.setUUID(*uuidToKeep_);
    isUUIDWritten_ = true;
    if (auto written = metadata.writeMetadataToDisk(); !written) return written;
  }
  if (auto moved = moveReplacement(); !moved) return moved;
  if (auto dropped = TSYRemoveFromCache(*replacement_); !dropped) return dropped;
  isReplacementDropped_ = true;
  return TSYAddToCache(metadata, destination_, /*transient=*/old_ && old_->transient(),
                       /*updateSandbox=*/true);
}

TSYResult<void> TSYContainerExchange::moveReplacement() {
  TSYFileManager& files = TSYFileManager::defaultManager();
  auto moved = files.moveItemAtURL(replacement_->url(), destination_);
  isReplacementMoved_ = moved.has_value();
  if (moved) moved = files.syncDirectoryOfItemAtURL(destination_);
  if (moved) return {};
  return TSYFailure(TSYErrorCreate(
      TSYErrorReplaceFailed, moved.error(), TSYLogIt::yes, "Failed to replace: {} with: {} at: {}",
      old_ ? old_->url().path() : "(null)", replacement_->url().path(), destination_.path()));
}

// Where the old container has to go the new one must not stay, even if it is lost.
void TSYContainerExchange::takeReplacementBack() {
  const TSYURL url = replacement_->url();
  const auto moved = TSYFileManager::defaultManager().moveItemAtURL(destination_, url);
  if (moved) return reenterReplacement(url);
  TSYLogWrite(TSYLogLevelError, "Failed to move {} back to {}: {}", destination_.path(), url.path(),
              moved.error());
  isUUIDWritten_ = false;
  if (!old_ || old_->url() != destination_) return reenterReplacement(destination_);
  (void)TSYClientConnection::_moveItemAtURLToDeathRow(destination_, /*startDeletionThread=*/false);
  if (!isReplacementDropped_) (void)TSYRemoveFromCache(*replacement_);
}

void TSYContainerExchange::reenterReplacement(const TSYURL& url) {
  const bool isStill = !isReplacementDropped_ && url == replacement_->url();
  if (isStill) return;
  (void)TSYAddToCache(*replacement_, url, replacement_->transient(), /*updateSandbox=*/true);
}

bool TSYContainerExchange::putOldBack() {
  TSYLogWrite(TSYLogLevelDebug, "Recovering from failed replace by moving: {} to {}",
              staging_.path(), old_->url().path());
  const auto moved = TSYFileManager::defaultManager().renameItemAtURL(staging_, old_->url());
  if (moved) return true;
  (void)TSYErrorCreate(TSYErrorReplaceFileInvalid, moved.error(), TSYLogIt::yes,
                       "Failed to recover replace move: {} to {}", staging_.path(),
                       old_->url().path());
  return false;
}

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
  if (!over_ && !undo()) std::abort();
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
  if (isUUIDWritten_ && !replacement_->writeMetadataToDisk()) {
    TSYLogWrite(TSYLogLevelError, "Failed to give {} its UUID back", replacement_->url().path());
  }
  const bool isOldBack = !isOldStaged_ || putOldBack();
  if (isOldDropped_ && isOldBack) {
    (void)TSYAddToCache(*old_, old_->url(), old_->transient(), /*updateSandbox=*/true);
  }
  if (isReplacementDropped_ &&
      TSYFileManager::defaultManager().itemExistsAtURL(replacement_->url())) {
    (void)TSYAddToCache(*replacement_, replacement_->url(), replacement_->transient(),
                        /*updateSandbox=*/true);
  }
  return isOldBack;
}

TSYResult<void> TSYContainerExchange::takeOldAside() {
  const auto moved = TSYFileManager::defaultManager().moveItemAtURL(old_->url(), staging_);
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

// The destination must be free for the old container, if need be at the cost of the new one.
void TSYContainerExchange::takeReplacementBack() {
  const auto moved =
      TSYFileManager::defaultManager().moveItemAtURL(destination_, replacement_->url());
  if (moved) return;
  TSYLogWrite(TSYLogLevelError, "Failed to move {} back to {}: {}", destination_.path(),
              replacement_->url().path(), moved.error());
  isUUIDWritten_ = false;
  (void)TSYClientConnection::_moveItemAtURLToDeathRow(destination_, /*startDeletionThread=*/false);
}

bool TSYContainerExchange::putOldBack() {
  TSYLogWrite(TSYLogLevelDebug, "Recovering from failed replace by moving: {} to {}",
              staging_.path(), old_->url().path());
  const auto moved = TSYFileManager::defaultManager().moveItemAtURL(staging_, old_->url());
  if (moved) return true;
  (void)TSYErrorCreate(TSYErrorReplaceFileInvalid, moved.error(), TSYLogIt::yes,
                       "Failed to recover replace move: {} to {}", staging_.path(),
                       old_->url().path());
  return false;
}

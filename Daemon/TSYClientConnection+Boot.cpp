// What start-up runs on the daemon's own connection.
#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYDaemonQueues.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"

namespace {

std::vector<TSYURL> itemsInGlobalStaging() {
  const TSYURL staging = TSYGlobalConfiguration::sharedInstance().stagingDirectory();
  auto items = TSYFileManager::defaultManager().urlsForItemsInDirectoryAtURL(staging);
  if (items) return std::move(*items);
  if (!items.error().isPosix(ENOENT)) {
    TSYLogWrite(TSYLogLevelError, "Failed to get items at global staging URL: {} : {}",
                staging.path(), items.error());
  }
  return {};
}

void appendItemsInStagingOf(const TSYUserIdentityRef& identity, std::vector<TSYURL>& list) {
  const auto staging = TSYGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(
      identity, kTSYContainerClassAppData);
  if (!staging) return;
  auto items = TSYFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*staging);
  if (items) {
    list.insert(list.end(), items->begin(), items->end());
  } else if (!items.error().isPosix(ENOENT)) {
    TSYLogWrite(TSYLogLevelError, "Failed to get items at per-user staging URL: {} : {}",
                staging->path(), items.error());
  }
}

// The journal of a replace and its staging directory have the same name.
bool belongsToReplace(const TSYURL& item) {
  const std::string journal = std::string(item.lastPathComponent()) + ".plist";
  return !TSYFileManager::defaultManager().itemDoesNotExistAtURL(
      TSYGlobalConfiguration::sharedInstance().replaceDirectory().appending(journal));
}

}  // namespace

void TSYClientConnection::tessarySetup() {
  const auto recovered = TSYCatchingExceptions([] { return _recoverFromReplaceOperations(); });
  if (recovered) return;
  TSYLogWrite(TSYLogLevelError, "Failed recovering from replace operations: {}", recovered.error());
}

void TSYClientConnection::tessaryCleanupWithCompletion(std::function<void(uint64_t)> completion) {
  // Everything in staging at start-up belongs to a creation that was cut short, but for what a
  // replace that could not be repaired keeps there: it may be all that is left of a container.
  std::vector<TSYURL> items = itemsInGlobalStaging();
  userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&items](const TSYUserIdentityRef& identity) {
        if (identity) appendItemsInStagingOf(identity, items);
      });
  std::erase_if(items, belongsToReplace);
  TSYAsyncKeepingAlive(backgroundQueue(),
                       [items = std::move(items), completion = std::move(completion)] {
                         for (const TSYURL& item : items) {
                           // What cannot be moved stays for the next start.
                           (void)_moveItemAtURLToDeathRow(item, /*startDeletionThread=*/false);
                         }
                         deleteContainersOnDeathRowWithCompletion(completion);
                       });
}

void TSYClientConnection::sentence(const TSYURL& url, std::string_view kind) {
  const auto moved = _moveItemAtURLToDeathRow(url, /*startDeletionThread=*/false);
  if (moved) return;
  TSYLogWrite(TSYLogLevelError, "Failed to delete {} URL {} : {}", kind, url.path(), moved.error());
}

void TSYClientConnection::sentenceTransientContainers() {
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  sentence(configuration.transientDirectory(), "shared transient");
  if (const auto legacy = configuration.legacyTransientBundleDirectory()) {
    TSYLogWrite(TSYLogLevelNotice,
                "Sentencing legacy transient bundle directory [{}] to final deletion",
                legacy->path());
    sentence(*legacy, "legacy shared transient bundle");
  }
  sentence(configuration.transientBundleDirectory(), "shared transient bundle");
}

void TSYClientConnection::queueOrphanCleanup(const TSYUserIdentityRef& userIdentity,
                                             TSYContainerClass containerClass) {
  const auto directory =
      TSYGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
          userIdentity, containerClass, /*transient=*/false);
  std::optional<std::vector<TSYURL>> directories;
  if (directory) {
    if (auto items = TSYFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory)) {
      directories = std::move(*items);
    }
  }
  backgroundQueue().async([this, containerClass, directories = std::move(directories)] {
    _cleanupOrphanedDataForDirectories(directories, containerClass);
  });
}

void TSYClientConnection::_cleanupOrphanedDataForDirectories(
    const std::optional<std::vector<TSYURL>>& directories, TSYContainerClass containerClass) {
  if (!directories) {
    TSYLogWrite(TSYLogLevelError, "Failed to get items : {}", containerClass);
    return;
  }
  TSYFileManager& files = TSYFileManager::defaultManager();
  for (const TSYURL& url : *directories) {
    if (files.itemDoesNotExistAtURL(url)) {
      TSYSystemLogWrite(TSYChannel::unspecified, platform::LogLevel::standard,
                        "Ignoring deleted container path during cleanup: [{}]", url.path());
      continue;
    }
    if (TSYContainerCache::containerURLIsValidForContainerClass(url, containerClass)) {
      // Only one that is known not to be there: a file that cannot be looked at is no reason.
      if (!files.itemDoesNotExistAtURL(url.appending(kTSYMetadataFileName))) continue;
      TSYLogWrite(TSYLogLevelError, "Deleting orphaned data missing a metadata file at: {}",
                  url.path());
    }
    if (TSYGlobalConfiguration::sharedInstance().isInternalImage()) {
      TSYLogWrite(TSYLogLevelError, "Orphaned data found; please file a problem report with this:");
      files.printDirectoryStructureAtURL(url);
      TSYLogWrite(TSYLogLevelError, "End of the orphaned data at {}", url.path());
    }
    (void)_moveItemAtURLToDeathRow(url, /*startDeletionThread=*/false);
  }
}

void TSYClientConnection::rebootTessaryCleanupWithCompletion(std::function<void()> completion) {
  sentenceTransientContainers();
  userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [this](const TSYUserIdentityRef& identity) {
        if (!identity) return;
        TSYPerUserConfiguration& configuration =
            TSYGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserIdentity(
                identity);
        if (!configuration.existsUserBaseDirectory()) return;
        if (const auto transient = configuration.transientDirectory()) {
          sentence(*transient, "per-user transient");
        }
        for (TSYContainerClass number = 1; number < kTSYContainerClassMax; ++number) {
          if (TSYIsPerUserClass(number)) queueOrphanCleanup(identity, number);
        }
      });
  for (TSYContainerClass number = 1; number < kTSYContainerClassMax; ++number) {
    if (TSYIsGlobalClass(number)) {
      queueOrphanCleanup(TSYUserIdentityCache::defaultUserIdentity(), number);
    }
  }
  TSYAsyncKeepingAlive(backgroundQueue(), _cleanupOprhanedCodeSigningMappingData);
  TSYAsyncKeepingAlive(backgroundQueue(), [completion = std::move(completion)] {
    if (completion) completion();
  });
}

// What was registered ahead of installations that the last shutdown cut short.
void TSYClientConnection::_cleanupOprhanedCodeSigningMappingData() {
  const auto removed = TSYCodeSigningMapping::sharedInstance().removeAllAdvanceCopies();
  if (removed) return;
  TSYLogWrite(TSYLogLevelError, "Could not remove advance copies of code sign data: {}",
              removed.error());
}

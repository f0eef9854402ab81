// What start-up runs on the daemon's own connection.

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYDaemonQueues.h"
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

}  // namespace

void TSYClientConnection::tessaryCleanupWithCompletion(std::function<void(uint64_t)> completion) {
  // Everything in staging at start-up belongs to a creation that was cut short.
  std::vector<TSYURL> items = itemsInGlobalStaging();
  userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&items](const TSYUserIdentityRef& identity) {
        if (identity) appendItemsInStagingOf(identity, items);
      });
  TSYAsyncKeepingAlive(
      backgroundQueue(), [this, items = std::move(items), completion = std::move(completion)] {
        for (const TSYURL& item : items) {
          // What cannot be moved stays for the next start.
          (void)_moveItemAtURLToDeathRow(item, /*isDir=*/true, /*startDeletionThread=*/false);
        }
        deleteContainersOnDeathRowWithCompletion(completion);
      });
}

#include "Daemon/TSYCacheSteps.h"

#include "Daemon/TSYContainerCache.h"

TSYResult<TSYMetadataRef> TSYFindContainer(const TSYConcreteContainerIdentity& identity) {
  TSYMetadataRef container =
      TSYContainerCache::sharedInstance().containerForContainerIdentity(identity);
  if (container) return container;
  return TSYFailure(TSYErrorCreate(TSYErrorNotFound, std::nullopt, TSYLogIt::yes,
                                   "No Container with identity: {}", identity.description()));
}

TSYResult<void> TSYAddToCache(const TSYMetadata& container, const TSYURL& url, bool transient,
                              bool updateSandbox) {
  const auto added = TSYContainerCache::sharedInstance().addContainerMetadata(
      container, url, transient, updateSandbox);
  if (added) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorCacheAddFailed, added.error(), TSYLogIt::yes,
                                   "Failed to add to cache: {}, url: {}, transient: {:d}",
                                   container.description(), url.path(), transient));
}

TSYResult<void> TSYRemoveFromCache(const TSYMetadata& container) {
  const auto removed = TSYContainerCache::sharedInstance().removeContainerForUserIdentity(
      container.userIdentity(), container.containerClass(), container.identifier(),
      container.transient());
  if (removed) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorCacheRemoveFailed, removed.error(), TSYLogIt::yes,
                                   "Failed to remove from cache id: {}, class: {}, transient: {:d}",
                                   container.identifier(), container.containerClass(),
                                   container.transient()));
}

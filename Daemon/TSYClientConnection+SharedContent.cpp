// The staging of shared content: an item moves from one place to another inside a system group
// container, and is opened to the group on the way.
//
// All of the group may write there, and put links and other items in the way meanwhile. Both paths
// are resolved once; the real ones must lie inside the container by their text, and nothing follows
// links from then on.
#include <algorithm>

#include "Daemon/TSYCacheSteps.h"
#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYPropertyList.h"

namespace {

TSYFileManager& fileManager() {
  return TSYFileManager::defaultManager();
}

std::string textOf(const std::optional<std::string>& value) {
  return value.value_or("(null)");
}

// The real path of what a client names in the container; none when it is not inside, and for the
// container itself and its metadata file, which are the daemon's.
std::optional<TSYURL> itemInContainer(const TSYMetadata& container, const TSYURL& url) {
  auto real = fileManager().realPathForURL(url, container.url());
  if (!real || !real->isInside(container.url()) || *real == container.metadataFileURL()) {
    return std::nullopt;
  }
  return real;
}

TSYResult<TSYURL> stage(const TSYMetadata& container, const std::string& sourceRelativePath,
                        const std::string& destRelativePath) {
  const TSYURL sourceURL = container.url().appending(sourceRelativePath);
  TSYURL destURL = container.url().appending(destRelativePath);
  const auto source = itemInContainer(container, sourceURL);
  if (!source) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidPath, std::nullopt, TSYLogIt::yes,
                                     "Invalid source URL {} for {} at {}", sourceURL.path(),
                                     container.identifier(), container.url().path()));
  }
  const auto dest = itemInContainer(container, destURL);
  if (!dest) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidPath, std::nullopt, TSYLogIt::yes,
                                     "Invalid dest URL {} for {} at {}", destURL.path(),
                                     container.identifier(), container.url().path()));
  }
  const auto standardized =
      fileManager().standardizeACLsAtURL(*source, /*isSystemContainer=*/false);
  if (!standardized) {
    return TSYFailure(TSYErrorCreate(TSYErrorACLFailed, standardized.error(), TSYLogIt::yes,
                                     "Failed to standardize ACLs for {} at {}: {}",
                                     container.identifier(), source->path(), standardized.error()));
  }
  // Never copied: what lies on another file system is mounted there, and no part of the container.
  const auto moved = fileManager().renameItemAtURL(*source, *dest);
  if (!moved) {
    return TSYFailure(TSYErrorCreate(TSYErrorStageSharedContentFailed, moved.error(), TSYLogIt::yes,
                                     "Failed move for {} from {} to: {}: {}",
                                     container.identifier(), source->path(), dest->path(),
                                     moved.error()));
  }
  return destURL;
}

}  // namespace

TSYResult<TSYURL> TSYClientConnection::stageSharedContentForIdentifier(
    const std::optional<std::string>& identifier,
    const std::optional<std::string>& sourceRelativePath,
    const std::optional<std::string>& destRelativePath) {
  return TSYCatchingExceptions(
      [&] { return stageSharedContent(identifier, sourceRelativePath, destRelativePath); });
}

TSYResult<TSYURL> TSYClientConnection::stageSharedContent(
    const std::optional<std::string>& identifier,
    const std::optional<std::string>& sourceRelativePath,
    const std::optional<std::string>& destRelativePath) {
  const std::optional<platform::Value> name =
      identifier ? std::optional<platform::Value>(*identifier) : std::nullopt;
  const auto identity = TSYContainerIdentity::containerIdentityWithUserIdentity(
      TSYUserIdentityCache::defaultUserIdentity(), name ? &*name : nullptr,
      kTSYContainerClassSystemGroup);
  if (!identity) return TSYFailure(identity.error());
  if (!sourceRelativePath || !destRelativePath) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Can't act on invalid input: ID: {}, source: {}, dest: {}",
                                     *identifier, textOf(sourceRelativePath),
                                     textOf(destRelativePath)));
  }
  if (containsDotDotPathComponents(*sourceRelativePath) ||
      containsDotDotPathComponents(*destRelativePath)) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidArgument, std::nullopt, TSYLogIt::yes,
                                     "Paths can't contain dots. source: {}, dest: {}",
                                     *sourceRelativePath, *destRelativePath));
  }
  if (!isMemberOfSystemGroup(*identifier)) {
    return TSYFailure(TSYErrorCreate(TSYErrorNotEntitled, std::nullopt, TSYLogIt::yes,
                                     "{} not entitled for system group container {}",
                                     clientBundleIdentifier(), *identifier));
  }
  const auto notFound = [&](const TSYError& error) {
    return TSYFailure(TSYErrorCreate(TSYErrorNotFound, error, TSYLogIt::yes,
                                     "System group container with identifier {} not found: {}",
                                     *identifier, error));
  };
  const auto found = TSYContainerCache::sharedInstance().containerForContainerIdentity(
      *identity, /*transient=*/false, /*updateSandbox=*/true);
  if (!found) return notFound(found.error());
  const TSYIdentifierLock lock(TSYLockMode::writing, (*found)->uuid().string(),
                               /*useLocking=*/true);
  const auto container = TSYFindContainer((*found)->containerIdentity());
  if (!container) return notFound(container.error());
  return stage(**container, *sourceRelativePath, *destRelativePath);
}

bool TSYClientConnection::isMemberOfSystemGroup(const std::string& group) const {
  const auto groups = TSYCodeSigningMapping::sharedInstance().systemGroupIdentifiersForIdentifier(
      clientBundleIdentifier());
  return groups && std::ranges::find(*groups, group) != groups->end();
}

#include "Daemon/TSYContainerCache.h"

#include <malloc.h>

#include <set>

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYInvariant.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYWhitelist.h"
#include "Platform/os/Platform.h"
#include "Platform/os/Signpost.h"

using platform::MutexLock;

namespace {

// From this size of a class on, what its scan needed is worth giving back.
constexpr size_t kManyContainers = 1'000;

const char* mark(bool transient) {
  return transient ? "(transient)" : "";
}

// Whether a metadata file is not there any more. What cannot be told for now is no reason to forget
// a container.
bool hasGone(const TSYURL& file) {
  const auto exists = platform::Platform::current().files.exists(file.path());
  if (exists) return false;
  const int error = exists.error().value;
  if (error == ENOENT || error == ENOTDIR || error == ELOOP) return true;
  TSYLogWrite(TSYLogLevelError, "Failed to determine if {} exists: {}", file.path(),
              exists.error().message());
  return false;
}

// A metadata file that could not be read for want of descriptors or memory says nothing about its
// container: the scan would miss it for good.
bool isOutOfResources(const TSYError& error) {
  const auto& underlying = error.underlying();
  return underlying && (underlying->isPosix(EMFILE) || underlying->isPosix(ENFILE) ||
                        underlying->isPosix(ENOMEM));
}

std::string_view identifierOf(const TSYUserIdentityRef& userIdentity) {
  return userIdentity ? std::string_view(userIdentity->identifier()) : std::string_view();
}

}  // namespace

size_t TSYContainerCache::IdentifierHash::operator()(const std::string& identifier) const {
  return std::hash<std::string>{}(identifier);
}

size_t TSYContainerCache::IdentifierHash::operator()(const TSYMetadataRef& metadata) const {
  return std::hash<std::string>{}(metadata->identifier());
}

bool TSYContainerCache::IdentifierEqual::operator()(const TSYMetadataRef& left,
                                                    const TSYMetadataRef& right) const {
  return left->identifier() == right->identifier();
}

bool TSYContainerCache::IdentifierEqual::operator()(const std::string& left,
                                                    const TSYMetadataRef& right) const {
  return left == right->identifier();
}

TSYMetadataRef TSYContainerCache::ClassCache::find(const std::string& identifier) const {
  const auto found = containers.find(identifier);
  return found == containers.end() ? nullptr : *found;
}

void TSYContainerCache::ClassCache::store(TSYMetadataRef metadata) {
  const auto [place, isNew] = containers.insert(metadata);
  if (isNew) return;
  // The one that is there is equal by identifier: it has to go for the new one to come in.
  containers.erase(place);
  containers.insert(std::move(metadata));
}

TSYContainerCache& TSYContainerCache::sharedInstance() {
  static TSYContainerCache& cache = *new TSYContainerCache(
      TSYUserIdentitySharedCache::sharedInstance(), TSYCodeSigningMapping::sharedInstance());
  return cache;
}

TSYContainerCache::TSYContainerCache(TSYUserIdentityCache& userIdentityCache,
                                     TSYCodeSigningMapping& codeSigningMapping)
    : userIdentityCache_(userIdentityCache), codeSigningMapping_(codeSigningMapping) {
  userIdentityCache_.addObserver(*this);
}

TSYContainerCache::~TSYContainerCache() {
  userIdentityCache_.removeObserver(*this);
}

TSYContainerCache::Key TSYContainerCache::_cacheKeyForUserIdentity(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass containerClass) {
  if (!TSYUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
    return {.user = {}, .containerClass = containerClass};
  }
  return {.user = identifierOf(userIdentity), .containerClass = containerClass};
}

fmt::format_context::iterator fmt::formatter<TSYContainerCache::Key>::format(
    const TSYContainerCache::Key& key, format_context& context) const {
  const std::string_view name = TSYContainerClassKey(key.containerClass);
  if (!TSYUserIdentity::isUserIdentityRequiredForContainerClass(key.containerClass)) {
    return fmt::format_to(context.out(), "{}", name);
  }
  return fmt::format_to(context.out(), "[{}]-{}", key.user, name);
}

bool TSYContainerCache::containerURLIsValidForContainerClass(const TSYURL& url,
                                                             TSYContainerClass containerClass) {
  const std::string name(url.lastPathComponent());
  return platform::UUID::parse(name).has_value() ||
         TSYWhitelist::sharedWhitelist().containerIdIsWellknown(name, containerClass);
}

TSYResult<TSYContainerCache::ClassCache*> TSYContainerCache::_lock_getCache(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass, bool transient,
    bool populateSandboxCache) {
  const Key key = _cacheKeyForUserIdentity(userIdentity, contentClass);
  auto& caches = _lock_caches(transient).at(contentClass);
  if (const auto found = caches.find(key.user); found != caches.end()) return &found->second;
  TSYSystemLogWrite(TSYChannel::cache, platform::LogLevel::debug,
                    "Rebuilding container class cache: {}{}", key, mark(transient));
  TSY_SIGNPOST_BEGIN(RebuildingCache, this, contentClass);
  auto scanned = _lock_scanWithOnePersonaList(userIdentity, contentClass, transient);
  // Only what becomes an entry is told to the sandbox: an invalidation finds it there.
  if (scanned && populateSandboxCache && !transient) _lock_pushMappings(*scanned);
  TSY_SIGNPOST_END(RebuildingCache, this, contentClass);
  // A scan needs several times what it leaves: the rest goes back to the system.
  if (scanned && scanned->containers.size() >= kManyContainers) ::malloc_trim(0);
  if (!scanned) {
    return TSYFailure(TSYErrorCreate(TSYErrorCacheRebuildFailed, scanned.error(), TSYLogIt::yes,
                                     "Cache: [{}]-{}{}: Failed to rebuild",
                                     identifierOf(userIdentity), TSYContainerClassKey(contentClass),
                                     mark(transient)));
  }
  return &caches.emplace(key.user, std::move(*scanned)).first->second;
}

// The list may change between the moment a request is given its identity and this one, and again
// during the scan, which resolves owners with the list. An entry made for a persona that is not
// there would be incomplete, and nothing would drop it when the persona comes back: only those that
// a list loses are invalidated.
TSYResult<TSYContainerCache::ClassCache> TSYContainerCache::_lock_scanWithOnePersonaList(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass, bool transient) {
  if (!userIdentity || !TSYIsPerUserClass(contentClass)) {
    return _lock_scan(userIdentity, contentClass, transient);
  }
  for (;;) {
    const auto generation = userIdentityCache_.generationOfListKnowing(*userIdentity);
    if (!generation) {
      return TSYFailure(TSYPosixErrorCreate(platform::Errno{ENOENT}, "the persona of {} has gone",
                                            _cacheKeyForUserIdentity(userIdentity, contentClass)));
    }
    auto scanned = _lock_scan(userIdentity, contentClass, transient);
    if (userIdentityCache_.generationOfListKnowing(*userIdentity) == generation) return scanned;
  }
}

TSYResult<TSYContainerCache::ClassCache> TSYContainerCache::_lock_scan(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass, bool transient) {
  const auto directory =
      TSYGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
          userIdentity, contentClass, transient);
  if (!directory) {
    return TSYFailure(TSYPosixErrorCreate(platform::Errno{ENOENT}, "no class directory for {}",
                                          _cacheKeyForUserIdentity(userIdentity, contentClass)));
  }
  auto items = TSYFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory);
  if (!items) return TSYFailure(std::move(items.error()));

  ClassCache cache{std::make_shared<const std::string>(directory->path()), {}};
  cache.containers.reserve(items->size());
  for (const TSYURL& item : *items) {
    if (!containerURLIsValidForContainerClass(item, contentClass)) continue;
    auto metadata =
        TSYMetadata::readAndValidateMetadataAtUrl(item, userIdentity,
                                                  /*checkClassPath=*/true, userIdentityCache_);
    if (!metadata && isOutOfResources(metadata.error())) {
      return TSYFailure(std::move(metadata.error()));
    }
    if (!metadata) continue;
    metadata->setURL(cache.directory, std::string(item.lastPathComponent()));
    metadata->setTransient(transient);
    metadata->setExisted(/*existed=*/true);
    cache.store(std::make_shared<const TSYMetadata>(std::move(*metadata)));
  }
  return cache;
}

TSYResult<TSYMetadataRef> TSYContainerCache::containerForContainerIdentity(
    const TSYContainerIdentity& identity, bool transient, bool updateSandbox) {
  return TSYCatchingExceptions([&] { return lookUp(identity, transient, updateSandbox); });
}

TSYResult<TSYMetadataRef> TSYContainerCache::lookUp(const TSYContainerIdentity& identity,
                                                    bool transient, bool updateSandbox) {
  TSY_INVARIANT(!codeSigningMapping_.isOnQueue());
  TSYMetadataRef container;
  {
    const MutexLock lock(cacheLock_);
    auto cache = _lock_getCache(identity.userIdentity(), identity.containerClass(), transient,
                                updateSandbox);
    if (!cache) return TSYFailure(std::move(cache.error()));
    container = (*cache)->find(identity.identifier());
  }
  if (!container) {
    // Lookups may miss: this is no line in the log.
    return TSYFailure(
        TSYErrorCreate(TSYErrorNotFound, std::nullopt, TSYLogIt::no,
                       "Cache: {}{}: Container Not Found with ID: {}",
                       _cacheKeyForUserIdentity(identity.userIdentity(), identity.containerClass()),
                       mark(transient), identity.identifier()));
  }
  auto onDisk = checkStillOnDisk({identity.userIdentity(), container}, transient);
  if (!onDisk) return TSYFailure(std::move(onDisk.error()));
  TSYLogWrite(TSYLogLevelDebug, "Cache: {}{}: Found Identifier: {}",
              _cacheKeyForUserIdentity(identity.userIdentity(), identity.containerClass()),
              mark(transient), identity.identifier());
  return container;
}

TSYMetadataRef TSYContainerCache::containerForContainerIdentity(
    const TSYConcreteContainerIdentity& identity) {
  const auto found = TSYCatchingExceptions(
      [&]() -> TSYResult<TSYMetadataRef> { return lookUpConcrete(identity); });
  return found ? *found : nullptr;
}

TSYMetadataRef TSYContainerCache::lookUpConcrete(const TSYConcreteContainerIdentity& identity) {
  const MutexLock lock(cacheLock_);
  for (const bool transient : {false, true}) {
    const auto cache = _lock_getCache(identity.userIdentity(), identity.containerClass(), transient,
                                      /*populateSandboxCache=*/true);
    if (!cache) continue;
    TSYMetadataRef container = (*cache)->find(identity.identifier());
    if (container && container->uuid() == identity.uuid()) return container;
  }
  return nullptr;
}

TSYResult<void> TSYContainerCache::checkStillOnDisk(const Found& found, bool transient) {
  const TSYMetadata& container = *found.container;
  const TSYURL file = container.metadataFileURL();
  if (!hasGone(file)) return {};
  TSYError inconsistent = TSYErrorCreate(
      TSYErrorCacheInconsistent, std::nullopt, TSYLogIt::yes,
      "Cache: {}{}: INCONSISTENT-No Metadata at: {} for id: {}, class: {}",
      _cacheKeyForUserIdentity(found.keyedUnder, container.containerClass()), mark(transient),
      file.path(), container.identifier(), container.containerClass());
  const auto removed = remove(found.keyedUnder, container.containerClass(), container.identifier(),
                              transient, found.container);
  if (!removed) {
    TSYLogWrite(TSYLogLevelError,
                "Failed to remove from cache user: {}, id: {}, class: {}, transient: {:d} : {}",
                identifierOf(found.keyedUnder), container.identifier(), container.containerClass(),
                transient, removed.error());
  }
  return TSYFailure(std::move(inconsistent));
}

TSYResult<std::vector<TSYMetadataRef>> TSYContainerCache::allContainersForUserIdentity(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass, bool transient,
    bool populateSandboxCache) {
  return TSYCatchingExceptions(
      [&] { return list(userIdentity, contentClass, transient, populateSandboxCache); });
}

TSYResult<std::vector<TSYMetadataRef>> TSYContainerCache::list(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass, bool transient,
    bool populateSandboxCache) {
  if (!TSYIsContainerClass(contentClass)) {
    return TSYFailure(TSYErrorCreate(TSYErrorCacheInvalidInput, std::nullopt, TSYLogIt::yes,
                                     "Invalid Content Class: {}",
                                     static_cast<int64_t>(contentClass)));
  }
  auto collected = collect(userIdentity, contentClass, transient, populateSandboxCache);
  if (!collected) return TSYFailure(std::move(collected.error()));
  std::vector<TSYMetadataRef> containers;
  containers.reserve(collected->size());
  for (Found& found : *collected) {
    if (!checkStillOnDisk(found, transient)) continue;
    TSYLogWrite(TSYLogLevelDebug, "Cache: {}{}: ALL Found Identifier: {}",
                _cacheKeyForUserIdentity(found.keyedUnder, contentClass), mark(transient),
                found.container->identifier());
    containers.push_back(std::move(found.container));
  }
  return containers;
}

std::vector<TSYUserIdentityRef> TSYContainerCache::identitiesToList(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass) {
  if (!userIdentity || !userIdentity->isNoSpecificPersona()) return {userIdentity};
  // Identities that share a key would list the same containers twice.
  std::vector<TSYUserIdentityRef> identities;
  std::set<std::string_view> users;
  userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const TSYUserIdentityRef& accessible) {
        const Key key = _cacheKeyForUserIdentity(accessible, contentClass);
        if (users.insert(key.user).second) identities.push_back(accessible);
      });
  return identities;
}

TSYResult<std::vector<TSYContainerCache::Found>> TSYContainerCache::collect(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass, bool transient,
    bool populateSandboxCache) {
  const std::vector<TSYUserIdentityRef> identities = identitiesToList(userIdentity, contentClass);
  std::vector<Found> collected;
  std::optional<TSYError> failure;
  const MutexLock lock(cacheLock_);
  for (const TSYUserIdentityRef& identity : identities) {
    auto cache = _lock_getCache(identity, contentClass, transient, populateSandboxCache);
    if (!cache) {
      failure = std::move(cache.error());
      continue;
    }
    for (const TSYMetadataRef& container : (*cache)->containers) {
      collected.push_back({identity, container});
    }
  }
  if (failure) return TSYFailure(std::move(*failure));
  return collected;
}

TSYResult<void> TSYContainerCache::addContainerMetadata(const TSYMetadata& metadata,
                                                        const TSYURL& url, bool transient,
                                                        bool updateSandbox) {
  return TSYCatchingExceptions([&] { return add(metadata, url, transient, updateSandbox); });
}

TSYResult<void> TSYContainerCache::add(const TSYMetadata& metadata, const TSYURL& url,
                                       bool transient, bool updateSandbox) {
  if (url.path().empty()) {
    return TSYFailure(TSYErrorCreate(TSYErrorCacheInvalidInput, std::nullopt, TSYLogIt::yes,
                                     "Invalid input: URL: {}", "(null)"));
  }
  bool shouldRegister = false;
  {
    const MutexLock lock(cacheLock_);
    auto cache = _lock_getCache(metadata.userIdentity(), metadata.containerClass(), transient,
                                /*populateSandboxCache=*/true);
    if (!cache) return TSYFailure(std::move(cache.error()));
    TSYMetadata entry = metadata;
    if (url.deletingLastPathComponent().path() == *(*cache)->directory) {
      entry.setURL((*cache)->directory, std::string(url.lastPathComponent()));
    } else {
      entry.setURL(url);
    }
    entry.setTransient(transient);
    entry.setExisted(/*existed=*/true);
    (*cache)->store(std::make_shared<const TSYMetadata>(std::move(entry)));
    shouldRegister = updateSandbox &&
                     shouldRegisterSandboxMappingWithUserIdentity(
                         metadata.userIdentity(), metadata.identifier(), metadata.containerClass());
  }
  if (shouldRegister && !transient &&
      !setSandboxContainerMappingForUserIdentity(metadata.userIdentity(), metadata.identifier(),
                                                 metadata.containerClass(), url)) {
    TSYLogWrite(TSYLogLevelError, "Failed to set container mapping of {}, {}",
                metadata.identifier(), metadata.containerClass());
  }
  TSYLogWrite(TSYLogLevelDebug, "Cache: {}{}: Added Identifier: {}",
              _cacheKeyForUserIdentity(metadata.userIdentity(), metadata.containerClass()),
              mark(transient), metadata.identifier());
  return {};
}

TSYResult<void> TSYContainerCache::removeContainerForUserIdentity(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass,
    const std::string& identifier, bool transient) {
  return TSYCatchingExceptions(
      [&] { return remove(userIdentity, contentClass, identifier, transient, nullptr); });
}

TSYResult<void> TSYContainerCache::remove(const TSYUserIdentityRef& userIdentity,
                                          TSYContainerClass contentClass,
                                          const std::string& identifier, bool transient,
                                          const TSYMetadataRef& onlyIf) {
  if (!TSYIsContainerClass(contentClass)) {
    return TSYFailure(TSYErrorCreate(TSYErrorCacheInvalidInput, std::nullopt, TSYLogIt::yes,
                                     "Invalid Content Class: {}",
                                     static_cast<int64_t>(contentClass)));
  }
  bool shouldRegister = false;
  TSYUserIdentityRef owner = userIdentity;
  {
    const MutexLock lock(cacheLock_);
    auto cache = _lock_getCache(userIdentity, contentClass, transient,
                                /*populateSandboxCache=*/true);
    if (!cache) return TSYFailure(std::move(cache.error()));
    const TSYMetadataRef container = (*cache)->find(identifier);
    if (onlyIf && container != onlyIf) return {};
    if (container) {
      // The sandbox knows it by its owner, which need not be who asks.
      owner = container->userIdentity();
      (*cache)->containers.erase(container);
    }
    shouldRegister = shouldRegisterSandboxMappingWithUserIdentity(owner, identifier, contentClass);
  }
  if (shouldRegister && !transient &&
      !setSandboxContainerMappingForUserIdentity(owner, identifier, contentClass, std::nullopt)) {
    TSYLogWrite(TSYLogLevelError, "Failed to remove container mapping of {}, {}", identifier,
                contentClass);
  }
  TSYLogWrite(TSYLogLevelDebug, "Cache: {}{}: Removed Identifier: {}",
              _cacheKeyForUserIdentity(userIdentity, contentClass), mark(transient), identifier);
  return {};
}

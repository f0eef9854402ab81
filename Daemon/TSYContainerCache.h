// The index of containers in memory.
//
// The disk is the truth: each container directory carries its metadata file, and the daemon keeps
// no database of them. For each pair of user identity and class the cache scans the class directory
// once, when it is first asked, and keeps what validates; from then on an entry changes only by
// adding, removing and invalidation. While it scans it tells the kernel sandbox where each
// container lives, which is how the sandbox learns its mappings again after a restart.
//
// All operations may be called from any thread, but none on the code-signing mapping's queue: the
// registration decision asks the mapping.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

#include "Daemon/TSYContainerIdentity.h"
#include "Daemon/TSYError.h"
#include "Daemon/TSYMetadata.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Platform/base/Mutex.h"

class TSYCodeSigningMapping;

class TSYContainerCache : public TSYUserIdentityCacheObserver {
 public:
  static TSYContainerCache& sharedInstance();

  TSYContainerCache(TSYUserIdentityCache& userIdentityCache,
                    TSYCodeSigningMapping& codeSigningMapping);
  ~TSYContainerCache() override;
  TSYContainerCache(const TSYContainerCache&) = delete;
  TSYContainerCache& operator=(const TSYContainerCache&) = delete;

  TSYUserIdentityCache& userIdentityCache() { return userIdentityCache_; }

  // The container with this identity's user, class and identifier. Code 43 when the class directory
  // cannot be listed, 21 when there is none, 44 when its metadata file has gone from the disk; the
  // entry is dropped then, and the next lookup answers 21.
  TSYResult<TSYMetadataRef> containerForContainerIdentity(const TSYContainerIdentity& identity,
                                                          bool transient, bool updateSandbox);
  // The very container with this identity's UUID, live or transient; null when there is none.
  TSYMetadataRef containerForContainerIdentity(const TSYConcreteContainerIdentity& identity);

  // All containers of a class; of every accessible identity for the unspecific one. Codes 47, 43.
  TSYResult<std::vector<TSYMetadataRef>> allContainersForUserIdentity(
      const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass, bool transient,
      bool populateSandboxCache = true);

  // Enters a container at `url`, in the place of one with the same identifier. Codes 47, 43.
  TSYResult<void> addContainerMetadata(const TSYMetadata& metadata, const TSYURL& url,
                                       bool transient, bool updateSandbox);
  // Codes 47, 43. An identifier that is not there is success.
  TSYResult<void> removeContainerForUserIdentity(const TSYUserIdentityRef& userIdentity,
                                                 TSYContainerClass contentClass,
                                                 const std::string& identifier, bool transient);

  // Tells the sandbox a container's path, or with none that there is no container.
  bool setSandboxContainerMappingForUserIdentity(const TSYUserIdentityRef& userIdentity,
                                                 const std::string& identifier,
                                                 TSYContainerClass containerClass,
                                                 const std::optional<TSYURL>& url);
  // Whether a container of this identity is the one that the sandbox should see.
  bool shouldRegisterSandboxMappingWithUserIdentity(const TSYUserIdentityRef& userIdentity,
                                                    const std::string& identifier,
                                                    TSYContainerClass containerClass);
  // Whether a directory of this name can be a container of this class.
  static bool containerURLIsValidForContainerClass(const TSYURL& url,
                                                   TSYContainerClass containerClass);

  // Forgets everything of an identity, and has the sandbox forget it.
  void invalidateUserIdentity(const TSYUserIdentityRef& userIdentity);
  void userIdentityCacheDidInvalidateUserIdentity(TSYUserIdentityCache& cache,
                                                  const TSYUserIdentityRef& identity) override;

 private:
  // Containers by identifier, found without a second copy of it.
  struct IdentifierHash {
    using is_transparent = void;
    size_t operator()(const std::string& identifier) const;
    size_t operator()(const TSYMetadataRef& metadata) const;
  };
  struct IdentifierEqual {
    using is_transparent = void;
    bool operator()(const TSYMetadataRef& left, const TSYMetadataRef& right) const;
    bool operator()(const std::string& left, const TSYMetadataRef& right) const;
  };
  struct ClassCache {
    std::shared_ptr<const std::string> directory;
    std::unordered_set<TSYMetadataRef, IdentifierHash, IdentifierEqual> containers;

    TSYMetadataRef find(const std::string& identifier) const;
    void store(TSYMetadataRef metadata);
  };
  // By class, and within it by the user part of the key. An absent entry has not been scanned; a
  // present one is authoritative.
  using Caches = std::array<std::map<std::string, ClassCache, std::less<>>, kTSYContainerClassMax>;

  // The key of a class cache. It refers to the identity, and becomes text only in a message.
  struct Key {
    // The identifier of a class's user; empty for classes whose one cache is everybody's.
    std::string_view user;
    TSYContainerClass containerClass;
  };
  friend struct fmt::formatter<Key>;

  static Key _cacheKeyForUserIdentity(const TSYUserIdentityRef& userIdentity,
                                      TSYContainerClass containerClass);
  Caches& _lock_caches(bool transient) REQUIRES(cacheLock_) {
    return transient ? transientContainerCache_ : liveContainerCache_;
  }
  TSYResult<ClassCache*> _lock_getCache(const TSYUserIdentityRef& userIdentity,
                                        TSYContainerClass contentClass, bool transient,
                                        bool populateSandboxCache) REQUIRES(cacheLock_);
  // Fails when the persona of `userIdentity` has gone.
  TSYResult<ClassCache> _lock_scanWithOnePersonaList(const TSYUserIdentityRef& userIdentity,
                                                     TSYContainerClass contentClass, bool transient)
      REQUIRES(cacheLock_);
  TSYResult<ClassCache> _lock_scan(const TSYUserIdentityRef& userIdentity,
                                   TSYContainerClass contentClass, bool transient)
      REQUIRES(cacheLock_);
  void _lock_pushMappings(const ClassCache& cache) REQUIRES(cacheLock_);
  // A container and the identity under whose key it is kept.
  struct Found {
    TSYUserIdentityRef keyedUnder;
    TSYMetadataRef container;
  };
  std::vector<TSYUserIdentityRef> identitiesToList(const TSYUserIdentityRef& userIdentity,
                                                   TSYContainerClass contentClass);
  TSYResult<std::vector<Found>> collect(const TSYUserIdentityRef& userIdentity,
                                        TSYContainerClass contentClass, bool transient,
                                        bool populateSandboxCache);
  // Fails with code 44, and drops the entry, when the container's metadata file has gone.
  TSYResult<void> checkStillOnDisk(const Found& found, bool transient);

  TSYResult<TSYMetadataRef> lookUp(const TSYContainerIdentity& identity, bool transient,
                                   bool updateSandbox);
  TSYMetadataRef lookUpConcrete(const TSYConcreteContainerIdentity& identity);
  TSYResult<std::vector<TSYMetadataRef>> list(const TSYUserIdentityRef& userIdentity,
                                              TSYContainerClass contentClass, bool transient,
                                              bool populateSandboxCache);
  TSYResult<void> add(const TSYMetadata& metadata, const TSYURL& url, bool transient,
                      bool updateSandbox);
  // With `onlyIf` another container that has taken the identifier's place meanwhile stays.
  TSYResult<void> remove(const TSYUserIdentityRef& userIdentity, TSYContainerClass contentClass,
                         const std::string& identifier, bool transient,
                         const TSYMetadataRef& onlyIf);

  void forget(const TSYUserIdentityRef& userIdentity);

  TSYUserIdentityCache& userIdentityCache_;
  TSYCodeSigningMapping& codeSigningMapping_;
  platform::Mutex cacheLock_;
  Caches liveContainerCache_ GUARDED_BY(cacheLock_);
  Caches transientContainerCache_ GUARDED_BY(cacheLock_);
};

// "[501]-appData", or "systemData" of a class whose cache is everybody's.
template <>
struct fmt::formatter<TSYContainerCache::Key> {
  constexpr auto parse(format_parse_context& context) { return context.begin(); }
  auto format(const TSYContainerCache::Key& key, format_context& context) const
      -> format_context::iterator;
};

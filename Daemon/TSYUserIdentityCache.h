// Which user identities exist, and which one a request means: a mirror of the user-management
// service's persona list.
//
// The mirror is valid or not. A flush makes it invalid and tells the observers which enterprise
// identities went with it; the next read of a map fetches the list anew, under the lock, trying for
// up to a minute. All operations may be called from any thread. Observers are told after the lock
// has been released, so they may call back.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Daemon/TSYPersonaMirror.h"
#include "Daemon/TSYUserIdentity.h"
#include "Daemon/TSYUserIdentityObservers.h"
#include "Platform/base/Mutex.h"
#include "Platform/base/SerialQueue.h"

class TSYUserIdentityCache {
 public:
  using IdentitySet = TSYPersonaMirror::IdentitySet;
  using Sleep = std::function<void(std::chrono::seconds)>;

  // Begins invalid and follows the service's persona list.
  TSYUserIdentityCache();
  // `sleep` passes the time between two tries to fetch the list.
  explicit TSYUserIdentityCache(Sleep sleep);
  virtual ~TSYUserIdentityCache();
  TSYUserIdentityCache(const TSYUserIdentityCache&) = delete;
  TSYUserIdentityCache& operator=(const TSYUserIdentityCache&) = delete;

  // The identity of the "mobile" account, built once; none on a system without that account.
  static TSYUserIdentityRef defaultUserIdentity();
  // Decided once for the life of the process.
  static bool personasAreSupported();

  // The caller's persona of the request that the calling thread is serving: set by the dispatcher
  // for the length of one request, through this scope. Outside a request there is none.
  class CallerContext {
   public:
    explicit CallerContext(std::optional<std::string> personaUniqueString);
    ~CallerContext();
    CallerContext(const CallerContext&) = delete;
    CallerContext& operator=(const CallerContext&) = delete;

    const std::optional<std::string>& personaUniqueString() const { return personaUniqueString_; }

   private:
    const std::optional<std::string> personaUniqueString_;
    const CallerContext* const outer_;
  };

  // Each answers none when there is no such identity. A uid below 501 stands for "mobile".
  TSYUserIdentityRef userIdentityForCurrentContext();
  TSYUserIdentityRef userIdentityForCurrentContextWithUID(uid_t uid, gid_t gid);
  TSYUserIdentityRef userIdentityForPersonaUniqueString(
      std::optional<std::string_view> uniqueString, uid_t uid, gid_t gid);
  TSYUserIdentityRef userIdentityForCurrentUserWithPersonaUniqueString(
      std::optional<std::string_view> uniqueString);
  TSYUserIdentityRef userIdentityForPersonalPersona();
  TSYUserIdentityRef userIdentityForPersonalPersonaWithUID(uid_t uid, gid_t gid);
  TSYUserIdentityRef unspecificUserIdentity();
  TSYUserIdentityRef userIdentityWithPersonaID(uint32_t kernelPersonaID);

  // The identities that may own containers of a bundle: those the persona list gives, else the
  // personal one alone.
  IdentitySet userIdentitiesForBundleIdentifier(const std::string& bundleIdentifier);
  bool isBundleIdentifierAssociatedWithUserIdentity(const std::string& bundleIdentifier,
                                                    const TSYUserIdentity& identity);
  // The number of the persona list in force, another one after each flush; none when `identity` is
  // of an enterprise persona that the list lacks. What was worked out between two equal answers was
  // worked out with one list.
  std::optional<uint64_t> generationOfListKnowing(const TSYUserIdentity& identity);
  // Runs `block` once per distinct identity, without a lock.
  void forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      const std::function<void(const TSYUserIdentityRef&)>& block);

  void flush();
  // Takes a given list in place of the service's. No observer is told.
  void flushAndRepopulateWithUserIdentities(const std::vector<TSYUserIdentityRef>& identities);
  // The persona list has changed: flushes on the flush queue.
  void personaListDidUpdate();

  // An observer removes itself before it goes. removeObserver() waits until no other thread is
  // telling it of anything, so its caller holds no lock that the observer takes.
  void addObserver(TSYUserIdentityCacheObserver& observer);
  void removeObserver(TSYUserIdentityCacheObserver& observer);
  // Follows the persona list no longer.
  void unregister();

 private:
  // What the persona service holds on to in place of the cache, which may go before it.
  struct Registration;

  static TSYUserIdentityRef _updateUserIdentity(const TSYUserIdentityRef& identity, uid_t uid,
                                                gid_t gid);

  void registerForUpdates();
  TSYUserIdentityRef identityKnownForUniqueString(std::string_view uniqueString);

  // The mirror, made anew first when it is invalid.
  const TSYPersonaMirror& _lock_mirror() REQUIRES(lock_);
  void _lock_resync() REQUIRES(lock_);
  // Fetches the list until it is usable; ends the process when it never is.
  TSYPersonaMirror _lock_fetchMirror() REQUIRES(lock_);
  // Returns the identities that are no longer valid: the observers are told of them after the lock
  // has been released.
  std::vector<TSYUserIdentityRef> _lock_flush() REQUIRES(lock_);

  const Sleep sleep_;
  const std::shared_ptr<Registration> registration_;
  TSYUserIdentityObservers observers_;
  platform::Mutex lock_;
  TSYPersonaMirror mirror_ GUARDED_BY(lock_);
  bool cacheInvalid_ GUARDED_BY(lock_) = true;
  uint64_t generation_ GUARDED_BY(lock_) = 0;
  // The last one: its end waits for the flushes that are under way.
  platform::SerialQueue flushQueue_{"com.veltra.tessaryd.TSYUserIdentityCache.flushQueue"};
};

class TSYUserIdentitySharedCache : public TSYUserIdentityCache {
 public:
  static TSYUserIdentitySharedCache& sharedInstance();
};

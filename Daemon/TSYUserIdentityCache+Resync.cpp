// How the mirror of the persona list is kept.
//
// It is valid or not. A flush drops it; the next read makes it anew from the service's list, with
// the lock held all the while, so that everybody who asks meanwhile waits for the one answer. The
// daemon cannot decide whose a container is without the list: when the service has not given a
// usable one after a minute the process ends, and the service manager starts it again.
#include <cstdlib>
#include <thread>

#include "Daemon/TSYLog.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Platform/os/Platform.h"

namespace {

constexpr char kObserverService[] = "com.veltra.tessaryd.personaobserver";
constexpr unsigned kLastTry = 60;
constexpr std::chrono::seconds kBetweenTries{1};

void logFault(const std::string& text,
              std::source_location where = std::source_location::current()) {
  TSYSystemLogWriteText(TSYChannel::unspecified, platform::LogLevel::fault, TSYFunctionName(where),
                        text);
}

[[noreturn]] void endProcessWithoutPersonas() {
  TSYLogWrite(TSYLogLevelError,
              "Could not obtain persona attributes after exhausting retries, crashing");
  logFault("Could not obtain persona attributes after exhausting retries.");
  std::abort();
}

}  // namespace

// Its lock is held while the cache is told, so that the cache cannot go meanwhile.
struct TSYUserIdentityCache::Registration {
  platform::Mutex lock;
  TSYUserIdentityCache* cache GUARDED_BY(lock) = nullptr;
};

TSYUserIdentityCache::TSYUserIdentityCache()
    : TSYUserIdentityCache([](std::chrono::seconds time) { std::this_thread::sleep_for(time); }) {}

TSYUserIdentityCache::TSYUserIdentityCache(Sleep sleep)
    : sleep_(std::move(sleep)), registration_(std::make_shared<Registration>()) {
  flush();
  // On a device without personas there is no list to follow.
  if (personasAreSupported()) registerForUpdates();
}

TSYUserIdentityCache::~TSYUserIdentityCache() {
  unregister();
}

void TSYUserIdentityCache::registerForUpdates() {
  {
    const platform::MutexLock lock(registration_->lock);
    registration_->cache = this;
  }
  const auto listDidUpdate = [registration = registration_] {
    const platform::MutexLock lock(registration->lock);
    if (registration->cache != nullptr) registration->cache->personaListDidUpdate();
  };
  const std::optional<std::string> error =
      platform::Platform::current().personas.observe(kObserverService, listDidUpdate);
  if (!error) {
    TSYLogWrite(TSYLogLevelNotice, "Registered for persona list updates.");
    return;
  }
  TSYLogWrite(TSYLogLevelError, "Failed to register for persona list updates: {}", *error);
  logFault(fmt::format("Failed to register for persona list updates: {}", *error));
  unregister();
}

void TSYUserIdentityCache::unregister() {
  const platform::MutexLock lock(registration_->lock);
  registration_->cache = nullptr;
}

void TSYUserIdentityCache::personaListDidUpdate() {
  TSYLogWrite(TSYLogLevelNotice, "The persona list has changed.");
  // Shared, because the queue's work must be copyable.
  const auto transaction = std::make_shared<platform::KeepAlive::Transaction>(
      platform::Platform::current().keepAlive, "com.veltra.tessaryd.personaListDidUpdate");
  flushQueue_.async([this, transaction] { flush(); });
}

const TSYPersonaMirror& TSYUserIdentityCache::_lock_mirror() {
  if (cacheInvalid_) _lock_resync();
  return mirror_;
}

void TSYUserIdentityCache::_lock_resync() {
  if (personasAreSupported()) mirror_ = _lock_fetchMirror();
  cacheInvalid_ = false;
}

TSYPersonaMirror TSYUserIdentityCache::_lock_fetchMirror() {
  for (unsigned tryNumber = 0;; ++tryNumber) {
    const auto personas = platform::Platform::current().personas.list();
    TSYLogWrite(TSYLogLevelDebug, "Got userPersonaAttributes: ({}) on try: {}",
                fmt::join(personas, ", "), tryNumber);
    if (!personas.empty()) {
      std::optional<TSYPersonaMirror> mirror = TSYPersonaMirror::ofPersonas(personas);
      if (mirror) return std::move(*mirror);
    } else if (tryNumber == 0) {
      TSYLogWrite(TSYLogLevelError, "Did not receive any persona attributes: ({})",
                  fmt::join(personas, ", "));
      logFault("Did not receive any persona attributes.");
    }
    if (tryNumber == kLastTry) endProcessWithoutPersonas();
    sleep_(kBetweenTries);
  }
}

void TSYUserIdentityCache::flush() {
  std::vector<TSYUserIdentityRef> invalidated;
  {
    const platform::MutexLock lock(lock_);
    invalidated = _lock_flush();
  }
  observers_.tell(*this, invalidated);
}

std::vector<TSYUserIdentityRef> TSYUserIdentityCache::_lock_flush() {
  std::vector<TSYUserIdentityRef> invalidated = mirror_.enterpriseIdentities();
  cacheInvalid_ = true;
  ++generation_;
  mirror_ = TSYPersonaMirror::withoutPersonas();
  return invalidated;
}

void TSYUserIdentityCache::flushAndRepopulateWithUserIdentities(
    const std::vector<TSYUserIdentityRef>& identities) {
  const platform::MutexLock lock(lock_);
  mirror_ = TSYPersonaMirror::ofUserIdentities(identities);
  ++generation_;
  cacheInvalid_ = false;
}

void TSYUserIdentityCache::addObserver(TSYUserIdentityCacheObserver& observer) {
  observers_.add(observer);
}

void TSYUserIdentityCache::removeObserver(TSYUserIdentityCacheObserver& observer) {
  observers_.remove(observer);
}

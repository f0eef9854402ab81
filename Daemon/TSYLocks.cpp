// One table for the process, under one mutex that is never held while waiting for a container: who
// holds one identifier for long blocks nobody else's work. A record exists from the first lock of
// its identifier to the last unlock.
#include "Daemon/TSYLocks.h"

#include <algorithm>
#include <atomic>
#include <map>
#include <memory>
#include <shared_mutex>

#include "Daemon/TSYInvariant.h"
#include "Daemon/TSYLog.h"
#include "Platform/base/Mutex.h"
#include "Platform/os/Signpost.h"

namespace {

using platform::MutexLock;
using std::atomic_load;

constexpr uint64_t kGlobalLockSignpost = 0xEEEEB0B5B2B2EEEE;

struct LockRecord {
  std::shared_mutex lock;
  unsigned references = 1;             // lock calls that have not been unlocked yet
  std::atomic<int32_t> lockState = 0;  // 0 free, n > 0 held by n readers, -1 held by a writer
};

struct LockTable {
  platform::Mutex mutex;
  std::map<std::string, std::unique_ptr<LockRecord>> identifierToLockMap GUARDED_BY(mutex);
  // Identifier locks held or being taken.
  uint32_t identifierReaderCount GUARDED_BY(mutex) = 0;
  uint32_t identifierWriterCount GUARDED_BY(mutex) = 0;
  // 0 no global lock, n > 0 n global readers, -1 one global writer.
  int32_t allReaderWriterState GUARDED_BY(mutex) = 0;

  platform::ConditionVariable idle;           // a global writer waits here
  platform::ConditionVariable globalReaders;  // a global reader waits here
  platform::ConditionVariable identifierWriters;
  platform::ConditionVariable identifierReaders;

  bool isIdle() const REQUIRES(mutex) {
    return identifierWriterCount == 0 && identifierReaderCount == 0 && allReaderWriterState == 0;
  }
};

LockTable& gTSYLocks = *new LockTable();

const char* purpose(bool writing) {
  return writing ? "writing" : "reading";
}

// Announces the lock to global ones and finds or makes the identifier's record.
LockRecord* enterIdentifier(const std::string& identifier, bool writing) {
  const MutexLock lock(gTSYLocks.mutex);
  if (writing) {
    while (gTSYLocks.allReaderWriterState != 0) gTSYLocks.identifierWriters.wait(gTSYLocks.mutex);
    ++gTSYLocks.identifierWriterCount;
  } else {
    while (gTSYLocks.allReaderWriterState == -1) gTSYLocks.identifierReaders.wait(gTSYLocks.mutex);
    ++gTSYLocks.identifierReaderCount;
  }
  std::unique_ptr<LockRecord>& record = gTSYLocks.identifierToLockMap[identifier];
  if (record) {
    ++record->references;
  } else {
    record = std::make_unique<LockRecord>();
  }
  return record.get();
}

void waitForWriting(LockRecord* lockPtr, const std::string& identifier) {
  const size_t signpost = std::hash<std::string>{}(identifier);
  TSY_SIGNPOST_BEGIN(WaitingForWriteLockWithIdentifier, signpost, identifier.c_str());
  lockPtr->lock.lock();
  TSY_SIGNPOST_END(WaitingForWriteLockWithIdentifier, signpost, identifier.c_str());
  int32_t expected = 0;
  TSY_INVARIANT(lockPtr->lockState.compare_exchange_strong(expected, -1));
  TSY_SIGNPOST_BEGIN(WriteLockWithIdentifier, signpost, identifier.c_str());
}

void waitForReading(LockRecord* lockPtr, const std::string& identifier) {
  const size_t signpost = std::hash<std::string>{}(identifier);
  TSY_SIGNPOST_BEGIN(WaitingForReadLockWithIdentifier, signpost, identifier.c_str());
  lockPtr->lock.lock_shared();
  TSY_SIGNPOST_END(WaitingForReadLockWithIdentifier, signpost, identifier.c_str());
  TSY_INVARIANT(lockPtr->lockState.fetch_add(1) >= 0);
  TSY_SIGNPOST_BEGIN(ReadLockWithIdentifier, signpost, identifier.c_str());
}

void takeOneLock(const std::string& identifier, bool writing) {
  LockRecord* lockPtr = enterIdentifier(identifier, writing);
  TSYLogWrite(TSYLogLevelDebug, "Waiting to lock {} for {}", identifier, purpose(writing));
  if (writing) {
    waitForWriting(lockPtr, identifier);
  } else {
    waitForReading(lockPtr, identifier);
  }
  TSYLogWrite(TSYLogLevelDebug, "Got lock on identifier {}", identifier);
}

void leaveReading(LockRecord* lockPtr, const std::string& identifier) REQUIRES(gTSYLocks.mutex) {
  lockPtr->lockState.fetch_sub(1);
  TSY_INVARIANT(gTSYLocks.allReaderWriterState >= 0);
  TSY_INVARIANT(gTSYLocks.identifierReaderCount > 0);
  --gTSYLocks.identifierReaderCount;
  TSY_SIGNPOST_END(ReadLockWithIdentifier, std::hash<std::string>{}(identifier),
                   identifier.c_str());
  if (gTSYLocks.isIdle()) gTSYLocks.idle.notifyOne();
  lockPtr->lock.unlock_shared();
}

void leaveWriting(LockRecord* lockPtr, const std::string& identifier) REQUIRES(gTSYLocks.mutex) {
  lockPtr->lockState.store(0);
  TSY_INVARIANT(gTSYLocks.allReaderWriterState == 0);
  TSY_INVARIANT(gTSYLocks.identifierWriterCount > 0);
  --gTSYLocks.identifierWriterCount;
  TSY_SIGNPOST_END(WriteLockWithIdentifier, std::hash<std::string>{}(identifier),
                   identifier.c_str());
  if (gTSYLocks.isIdle()) gTSYLocks.idle.notifyOne();
  if (gTSYLocks.identifierWriterCount == 0 && gTSYLocks.allReaderWriterState != -1) {
    gTSYLocks.globalReaders.notifyAll();
  }
  lockPtr->lock.unlock();
}

void unlockOneLock(const std::string& identifier) {
  const MutexLock lock(gTSYLocks.mutex);
  const auto found = gTSYLocks.identifierToLockMap.find(identifier);
  TSY_INVARIANT(found != gTSYLocks.identifierToLockMap.end());
  LockRecord* lockPtr = found->second.get();
  TSY_INVARIANT(atomic_load(&lockPtr->lockState) != 0);
  if (atomic_load(&lockPtr->lockState) > 0) {
    leaveReading(lockPtr, identifier);
  } else {
    leaveWriting(lockPtr, identifier);
  }
  TSYLogWrite(TSYLogLevelDebug, "Unlocked identifier {}", identifier);
  if (--lockPtr->references == 0) {
    TSYLogWrite(TSYLogLevelDebug, "Destroying lock for identifier {}", identifier);
    TSY_INVARIANT(atomic_load(&lockPtr->lockState) == 0);
    gTSYLocks.identifierToLockMap.erase(found);
  }
}

TSYIdentifiers sortedAndDistinct(TSYIdentifiers identifiers) {
  std::sort(identifiers.begin(), identifiers.end());
  identifiers.erase(std::unique(identifiers.begin(), identifiers.end()), identifiers.end());
  return identifiers;
}

void takeLocks(const TSYIdentifiers& identifiers, bool writing) {
  for (const std::string& identifier : sortedAndDistinct(identifiers)) {
    takeOneLock(identifier, writing);
  }
}

}  // namespace

void TSYLockIdentifierForReading(const std::string& identifier) {
  takeOneLock(identifier, /*writing=*/false);
}

void TSYLockIdentifierForWriting(const std::string& identifier) {
  takeOneLock(identifier, /*writing=*/true);
}

void TSYUnlockIdentifier(const std::string& identifier) {
  unlockOneLock(identifier);
}

void TSYLockIdentifiersForReading(const TSYIdentifiers& identifiers) {
  takeLocks(identifiers, /*writing=*/false);
}

void TSYLockIdentifiersForWriting(const TSYIdentifiers& identifiers) {
  takeLocks(identifiers, /*writing=*/true);
}

void TSYUnlockIdentifiers(const TSYIdentifiers& identifiers) {
  const TSYIdentifiers sorted = sortedAndDistinct(identifiers);
  std::for_each(sorted.rbegin(), sorted.rend(), unlockOneLock);
}

void TSYLockAllIdentifiersForReading() {
  TSYLogWrite(TSYLogLevelDebug, "Waiting to lock all identifiers for {}", "reading");
  TSY_SIGNPOST_BEGIN(WaitingForGlobalReadLock, kGlobalLockSignpost, 0);
  const MutexLock lock(gTSYLocks.mutex);
  while (gTSYLocks.identifierWriterCount > 0 || gTSYLocks.allReaderWriterState == -1) {
    gTSYLocks.globalReaders.wait(gTSYLocks.mutex);
  }
  TSY_SIGNPOST_END(WaitingForGlobalReadLock, kGlobalLockSignpost, 0);
  ++gTSYLocks.allReaderWriterState;
  TSY_SIGNPOST_BEGIN(GlobalReadLock, kGlobalLockSignpost, 0);
  TSYLogWrite(TSYLogLevelDebug, "Locked all identifiers for {}", "reading");
}

void TSYLockAllIdentifiersForWriting() {
  TSYLogWrite(TSYLogLevelDebug, "Waiting to lock all identifiers for {}", "writing");
  TSY_SIGNPOST_BEGIN(WaitingForGlobalWriteLock, kGlobalLockSignpost, 0);
  const MutexLock lock(gTSYLocks.mutex);
  while (!gTSYLocks.isIdle()) gTSYLocks.idle.wait(gTSYLocks.mutex);
  TSY_SIGNPOST_END(WaitingForGlobalWriteLock, kGlobalLockSignpost, 0);
  gTSYLocks.allReaderWriterState = -1;
  TSY_SIGNPOST_BEGIN(GlobalWriteLock, kGlobalLockSignpost, 0);
  TSYLogWrite(TSYLogLevelDebug, "Locked all identifiers for {}", "writing");
}

void TSYUnlockAllIdentifiers() {
  {
    const MutexLock lock(gTSYLocks.mutex);
    if (gTSYLocks.allReaderWriterState == -1) {
      gTSYLocks.allReaderWriterState = 0;
      TSY_SIGNPOST_END(GlobalWriteLock, kGlobalLockSignpost, 0);
      gTSYLocks.idle.notifyOne();
      gTSYLocks.globalReaders.notifyAll();
      gTSYLocks.identifierWriters.notifyAll();
      gTSYLocks.identifierReaders.notifyAll();
    } else {
      TSY_INVARIANT(gTSYLocks.allReaderWriterState > 0);
      --gTSYLocks.allReaderWriterState;
      TSY_SIGNPOST_END(GlobalReadLock, kGlobalLockSignpost, 0);
      if (gTSYLocks.allReaderWriterState == 0) gTSYLocks.identifierWriters.notifyAll();
      if (gTSYLocks.isIdle()) gTSYLocks.idle.notifyOne();
    }
  }
  TSYLogWrite(TSYLogLevelDebug, "Unlocked all identifiers");
}

TSYIdentifierLock::TSYIdentifierLock(TSYLockMode mode, std::string identifier, bool useLocking)
    : identifier_(std::move(identifier)), held_(useLocking) {
  if (held_) takeOneLock(identifier_, /*writing=*/mode == TSYLockMode::writing);
}

TSYIdentifierLock::~TSYIdentifierLock() {
  if (held_) TSYUnlockIdentifier(identifier_);
}

TSYAllIdentifiersLock::TSYAllIdentifiersLock(TSYLockMode mode, bool useLocking)
    : held_(useLocking) {
  if (!held_) return;
  if (mode == TSYLockMode::writing) {
    TSYLockAllIdentifiersForWriting();
  } else {
    TSYLockAllIdentifiersForReading();
  }
}

TSYAllIdentifiersLock::~TSYAllIdentifiersLock() {
  if (held_) TSYUnlockAllIdentifiers();
}

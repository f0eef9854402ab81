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

LockTable& table() {
  static LockTable& instance = *new LockTable();
  return instance;
}

const char* purpose(bool writing) {
  return writing ? "writing" : "reading";
}

// Announces the lock to global ones and finds or makes the identifier's record.
LockRecord& enterIdentifier(const std::string& identifier, bool writing) {
  LockTable& locks = table();
  const MutexLock lock(locks.mutex);
  if (writing) {
    while (locks.allReaderWriterState != 0) locks.identifierWriters.wait(locks.mutex);
    ++locks.identifierWriterCount;
  } else {
    while (locks.allReaderWriterState == -1) locks.identifierReaders.wait(locks.mutex);
    ++locks.identifierReaderCount;
  }
  std::unique_ptr<LockRecord>& record = locks.identifierToLockMap[identifier];
  if (record) {
    ++record->references;
  } else {
    record = std::make_unique<LockRecord>();
  }
  return *record;
}

void waitForWriting(LockRecord& record, const std::string& identifier) {
  const size_t signpost = std::hash<std::string>{}(identifier);
  TSY_SIGNPOST_BEGIN(WaitingForWriteLockWithIdentifier, signpost, identifier.c_str());
  record.lock.lock();
  TSY_SIGNPOST_END(WaitingForWriteLockWithIdentifier, signpost, identifier.c_str());
  int32_t expected = 0;
  TSY_INVARIANT(record.lockState.compare_exchange_strong(expected, -1));
  TSY_SIGNPOST_BEGIN(WriteLockWithIdentifier, signpost, identifier.c_str());
}

void waitForReading(LockRecord& record, const std::string& identifier) {
  const size_t signpost = std::hash<std::string>{}(identifier);
  TSY_SIGNPOST_BEGIN(WaitingForReadLockWithIdentifier, signpost, identifier.c_str());
  record.lock.lock_shared();
  TSY_SIGNPOST_END(WaitingForReadLockWithIdentifier, signpost, identifier.c_str());
  TSY_INVARIANT(record.lockState.fetch_add(1) >= 0);
  TSY_SIGNPOST_BEGIN(ReadLockWithIdentifier, signpost, identifier.c_str());
}

void takeOneLock(const std::string& identifier, bool writing) {
  LockRecord& record = enterIdentifier(identifier, writing);
  TSYLogWrite(TSYLogLevelDebug, "Waiting to lock {} for {}", identifier, purpose(writing));
  if (writing) {
    waitForWriting(record, identifier);
  } else {
    waitForReading(record, identifier);
  }
  TSYLogWrite(TSYLogLevelDebug, "Got lock on identifier {}", identifier);
}

void leaveReading(LockTable& locks, LockRecord& record, const std::string& identifier)
    REQUIRES(locks.mutex) {
  record.lockState.fetch_sub(1);
  TSY_INVARIANT(locks.allReaderWriterState >= 0);
  TSY_INVARIANT(locks.identifierReaderCount > 0);
  --locks.identifierReaderCount;
  TSY_SIGNPOST_END(ReadLockWithIdentifier, std::hash<std::string>{}(identifier),
                   identifier.c_str());
  if (locks.isIdle()) locks.idle.notifyOne();
  record.lock.unlock_shared();
}

void leaveWriting(LockTable& locks, LockRecord& record, const std::string& identifier)
    REQUIRES(locks.mutex) {
  record.lockState.store(0);
  TSY_INVARIANT(locks.allReaderWriterState == 0);
  TSY_INVARIANT(locks.identifierWriterCount > 0);
  --locks.identifierWriterCount;
  TSY_SIGNPOST_END(WriteLockWithIdentifier, std::hash<std::string>{}(identifier),
                   identifier.c_str());
  if (locks.isIdle()) locks.idle.notifyOne();
  if (locks.identifierWriterCount == 0 && locks.allReaderWriterState != -1) {
    locks.globalReaders.notifyAll();
  }
  record.lock.unlock();
}

void unlockOneLock(const std::string& identifier) {
  LockTable& locks = table();
  const MutexLock lock(locks.mutex);
  const auto found = locks.identifierToLockMap.find(identifier);
  TSY_INVARIANT(found != locks.identifierToLockMap.end());
  LockRecord& record = *found->second;
  const int32_t state = record.lockState.load();
  TSY_INVARIANT(state != 0);
  if (state > 0) {
    leaveReading(locks, record, identifier);
  } else {
    leaveWriting(locks, record, identifier);
  }
  TSYLogWrite(TSYLogLevelDebug, "Unlocked identifier {}", identifier);
  if (--record.references == 0) {
    TSYLogWrite(TSYLogLevelDebug, "Destroying lock for identifier {}", identifier);
    TSY_INVARIANT(record.lockState.load() == 0);
    locks.identifierToLockMap.erase(found);
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
  LockTable& locks = table();
  const MutexLock lock(locks.mutex);
  TSY_SIGNPOST_BEGIN(WaitingForGlobalReadLock, kGlobalLockSignpost, 0);
  while (locks.identifierWriterCount > 0 || locks.allReaderWriterState == -1) {
    locks.globalReaders.wait(locks.mutex);
  }
  TSY_SIGNPOST_END(WaitingForGlobalReadLock, kGlobalLockSignpost, 0);
  ++locks.allReaderWriterState;
  TSY_SIGNPOST_BEGIN(GlobalReadLock, kGlobalLockSignpost, 0);
  TSYLogWrite(TSYLogLevelDebug, "Locked all identifiers for {}", "reading");
}

void TSYLockAllIdentifiersForWriting() {
  TSYLogWrite(TSYLogLevelDebug, "Waiting to lock all identifiers for {}", "writing");
  LockTable& locks = table();
  const MutexLock lock(locks.mutex);
  TSY_SIGNPOST_BEGIN(WaitingForGlobalWriteLock, kGlobalLockSignpost, 0);
  while (!locks.isIdle()) locks.idle.wait(locks.mutex);
  TSY_SIGNPOST_END(WaitingForGlobalWriteLock, kGlobalLockSignpost, 0);
  locks.allReaderWriterState = -1;
  TSY_SIGNPOST_BEGIN(GlobalWriteLock, kGlobalLockSignpost, 0);
  TSYLogWrite(TSYLogLevelDebug, "Locked all identifiers for {}", "writing");
}

void TSYUnlockAllIdentifiers() {
  LockTable& locks = table();
  {
    const MutexLock lock(locks.mutex);
    if (locks.allReaderWriterState == -1) {
      locks.allReaderWriterState = 0;
      TSY_SIGNPOST_END(GlobalWriteLock, kGlobalLockSignpost, 0);
      locks.idle.notifyOne();
      locks.globalReaders.notifyAll();
      locks.identifierWriters.notifyAll();
      locks.identifierReaders.notifyAll();
    } else {
      TSY_INVARIANT(locks.allReaderWriterState > 0);
      --locks.allReaderWriterState;
      TSY_SIGNPOST_END(GlobalReadLock, kGlobalLockSignpost, 0);
      if (locks.allReaderWriterState == 0) locks.identifierWriters.notifyAll();
      if (locks.isIdle()) locks.idle.notifyOne();
    }
  }
  TSYLogWrite(TSYLogLevelDebug, "Unlocked all identifiers");
}

TSYAllIdentifiersLock::TSYAllIdentifiersLock(Mode mode, bool useLocking) : held_(useLocking) {
  if (!held_) return;
  if (mode == Mode::writing) {
    TSYLockAllIdentifiersForWriting();
  } else {
    TSYLockAllIdentifiersForReading();
  }
}

TSYAllIdentifiersLock::~TSYAllIdentifiersLock() {
  if (held_) TSYUnlockAllIdentifiers();
}

// The identifier locks: readers and one writer per container, and over all containers at once.
//
// An identifier is a container's UUID in text form. A global read lock lets readers of single
// containers through and holds writers off; a global write lock holds everybody off. Every lock
// call is paired with one unlock call for the same identifier or the same array, on the same
// thread.
//
// A thread must not take a global lock while it holds an identifier, nor the same identifier twice
// for writing, nor two arrays at once. An unpaired call stops the process.
#pragma once

#include <string>
#include <vector>

using TSYIdentifiers = std::vector<std::string>;

void TSYLockIdentifierForReading(const std::string& identifier);
void TSYLockIdentifierForWriting(const std::string& identifier);
void TSYUnlockIdentifier(const std::string& identifier);

// Arrays are locked in ascending order, each distinct identifier once, and unlocked in descending
// order.
void TSYLockIdentifiersForReading(const TSYIdentifiers& identifiers);
void TSYLockIdentifiersForWriting(const TSYIdentifiers& identifiers);
void TSYUnlockIdentifiers(const TSYIdentifiers& identifiers);

void TSYLockAllIdentifiersForReading();
void TSYLockAllIdentifiersForWriting();
void TSYUnlockAllIdentifiers();

enum class TSYLockMode { reading, writing };

// Holds one identifier for a scope, when the operation was asked to do its own locking.
class TSYIdentifierLock {
 public:
  TSYIdentifierLock(TSYLockMode mode, std::string identifier, bool useLocking);
  ~TSYIdentifierLock();
  TSYIdentifierLock(const TSYIdentifierLock&) = delete;
  TSYIdentifierLock& operator=(const TSYIdentifierLock&) = delete;

 private:
  const std::string identifier_;
  const bool held_;
};

// Holds a global lock for a scope, when the operation was asked to do its own locking.
class TSYAllIdentifiersLock {
 public:
  TSYAllIdentifiersLock(TSYLockMode mode, bool useLocking);
  ~TSYAllIdentifiersLock();
  TSYAllIdentifiersLock(const TSYAllIdentifiersLock&) = delete;
  TSYAllIdentifiersLock& operator=(const TSYAllIdentifiersLock&) = delete;

 private:
  const bool held_;
};

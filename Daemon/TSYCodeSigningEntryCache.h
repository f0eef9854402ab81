// The code-signing entries that were asked for last, so that a request of a known caller costs no
// read of the database.
//
// The mapping alone fills it, on its queue, with what it has just read, and empties it there after
// every change of the database: once a change has returned nothing older than it is found. find()
// may be called from any thread. When the cache is full it begins anew.
#pragma once

#include <optional>
#include <string>
#include <unordered_map>

#include "Daemon/TSYCodeSigningEntry.h"
#include "Platform/base/Mutex.h"

class TSYCodeSigningEntryCache {
 public:
  // Null for an identifier that is known to have no entry; none for one that is not known.
  std::optional<TSYCodeSigningEntryRef> find(const std::string& identifier) const;
  // An entry that alone would fill the cache is not kept.
  void store(const std::string& identifier, TSYCodeSigningEntryRef entryOrNull);
  void clear();

 private:
  static constexpr size_t kMostEntries = 1024;
  static constexpr size_t kMostBytes = 16 * 1024 * 1024;

  mutable platform::Mutex lock_;
  std::unordered_map<std::string, TSYCodeSigningEntryRef> entries_ GUARDED_BY(lock_);
  size_t bytes_ GUARDED_BY(lock_) = 0;
};

// What each user's connections take up, held against the limits per user. Any thread.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <map>
#include <memory>

#include "Platform/base/Mutex.h"
#include "Platform/ipc/server/Server.h"

namespace platform::ipc {

// The bytes that wait in the connections of one user.
class UserAccount {
 public:
  explicit UserAccount(size_t limit) : limit_(limit) {}

  // Returns false, with nothing charged, when it would go over the limit.
  bool charge(size_t bytes);
  void release(size_t bytes) { bufferedBytes_.fetch_sub(bytes, std::memory_order_relaxed); }

 private:
  const size_t limit_;
  std::atomic<size_t> bufferedBytes_ = 0;
};

// A part of an account's bytes: those of one buffer.
class BufferCharge {
 public:
  explicit BufferCharge(UserAccount& account) : account_(account) {}
  ~BufferCharge() { account_.release(bytes_); }
  BufferCharge(const BufferCharge&) = delete;
  BufferCharge& operator=(const BufferCharge&) = delete;

  // The buffer has this many bytes now. Returns false when that is over the user's limit.
  bool set(size_t bytes);

 private:
  UserAccount& account_;
  size_t bytes_ = 0;
};

class UserAccounts {
 public:
  explicit UserAccounts(const Limits& limits) : limits_(limits) {}

  // One more connection of a user, until the result and its copies are gone; null when the user has
  // as many as allowed. The accounts must outlive it.
  std::shared_ptr<UserAccount> admit(uid_t uid);

 private:
  struct Entry {
    std::shared_ptr<UserAccount> account;
    unsigned connections = 0;
  };
  void leave(uid_t uid);

  const Limits limits_;
  Mutex mutex_;
  std::map<uid_t, Entry> entries_ GUARDED_BY(mutex_);
};

}  // namespace platform::ipc

// Keep-alive transactions: while one is open the process is not to be ended. Their names tell what
// it is kept alive for. Any thread.
#pragma once

#include <chrono>
#include <set>
#include <string>
#include <vector>

#include "Platform/base/Mutex.h"

namespace platform {

class KeepAlive {
 public:
  // Open from construction to destruction; moves with its owner, also to another thread.
  class Transaction {
   public:
    Transaction(KeepAlive& keepAlive, std::string name);
    ~Transaction();
    Transaction(Transaction&& other) noexcept;
    Transaction& operator=(Transaction&&) = delete;

   private:
    KeepAlive* keepAlive_;
    std::multiset<std::string>::iterator place_;
  };

  // The names of those that are open.
  std::vector<std::string> openTransactions() const;
  // Waits until none is open; false when `timeout` has passed first.
  bool waitUntilIdle(std::chrono::milliseconds timeout);

 private:
  mutable Mutex mutex_;
  ConditionVariable idle_;
  std::multiset<std::string> open_ GUARDED_BY(mutex_);
};

}  // namespace platform

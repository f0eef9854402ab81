// Keep-alive transactions: while one is open the process is not to be ended. Any thread.
#pragma once

#include <chrono>
#include <memory>
#include <string>

#include "Platform/base/Mutex.h"

namespace platform {

class KeepAlive {
 public:
  // Open from construction to destruction; moves with its owner, also to another thread.
  class Transaction {
   public:
    explicit Transaction(KeepAlive& keepAlive);
    ~Transaction();
    Transaction(Transaction&& other) noexcept;
    Transaction& operator=(Transaction&&) = delete;

   private:
    KeepAlive* keepAlive_;
  };

  int openTransactions() const;
  // Waits until none is open; false when `timeout` has passed first.
  bool waitUntilIdle(std::chrono::milliseconds timeout);

 private:
  mutable Mutex mutex_;
  ConditionVariable idle_;
  int open_ GUARDED_BY(mutex_) = 0;
};

}  // namespace platform

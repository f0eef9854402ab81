#include "Platform/ipc/server/UserAccounts.h"

namespace platform::ipc {

bool UserAccount::charge(size_t bytes) {
  if (bufferedBytes_.fetch_add(bytes, std::memory_order_relaxed) + bytes <= limit_) return true;
  release(bytes);
  return false;
}

bool BufferCharge::set(size_t bytes) {
  if (bytes > bytes_ && !account_.charge(bytes - bytes_)) return false;
  if (bytes < bytes_) account_.release(bytes_ - bytes);
  bytes_ = bytes;
  return true;
}

std::shared_ptr<UserAccount> UserAccounts::admit(uid_t uid) {
  const MutexLock lock(mutex_);
  Entry& entry = entries_[uid];
  if (entry.account == nullptr) {
    entry.account = std::make_shared<UserAccount>(limits_.bufferedBytesOfUser);
  }
  const unsigned allowed = uid == 0 ? limits_.connectionsOfRoot : limits_.connectionsOfUser;
  if (entry.connections >= allowed) return nullptr;
  ++entry.connections;
  // The handle that counts the connection; it keeps the account itself alive.
  return {entry.account.get(), [this, uid, account = entry.account](UserAccount*) { leave(uid); }};
}

void UserAccounts::leave(uid_t uid) {
  const MutexLock lock(mutex_);
  const auto entry = entries_.find(uid);
  if (--entry->second.connections == 0) entries_.erase(entry);
}

}  // namespace platform::ipc

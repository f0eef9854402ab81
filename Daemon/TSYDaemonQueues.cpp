#include "Daemon/TSYDaemonQueues.h"

#include <memory>

#include "Platform/os/Platform.h"

using platform::KeepAlive;
using platform::SerialQueue;

SerialQueue& TSYDeathRowQueue() {
  static SerialQueue& queue =
      *new SerialQueue("com.veltra.tessaryd.deathrow", platform::QueuePriority::background);
  return queue;
}

SerialQueue& TSYLockStateQueue() {
  static SerialQueue& queue = *new SerialQueue("com.veltra.tessaryd.lockstate");
  return queue;
}

void TSYAsyncKeepingAlive(SerialQueue& queue, std::function<void()> work) {
  // Shared because a queue's work must be copyable.
  auto transaction = std::make_shared<KeepAlive::Transaction>(
      platform::Platform::current().keepAlive, queue.label());
  queue.async([transaction, work = std::move(work)] { work(); });
}

// The queues that the whole daemon shares, and work that must not be lost on them.
#pragma once

#include <functional>

#include "Platform/base/SerialQueue.h"

// All emptying of death row: one task at a time, at background priority. Any thread.
platform::SerialQueue& TSYDeathRowQueue();
// Work that needs the device unlocked: suspended while it is locked. Any thread.
platform::SerialQueue& TSYLockStateQueue();

// Puts `work` on a queue and keeps the process alive until it has run. Any thread.
void TSYAsyncKeepingAlive(platform::SerialQueue& queue, std::function<void()> work);

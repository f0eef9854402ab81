#include "Daemon/TSYCommandQueue.h"

#include "Daemon/TSYLog.h"

using platform::LogLevel;

void TSYCommandQueue::insertCommand(std::shared_ptr<TSYCommand> command) {
  {
    const platform::MutexLock lock(monitor_);
    commands_.push_back(command);
  }
  TSYSystemLogWrite(TSYChannel::unspecified, LogLevel::info, "Added command <{}; {}> to queue",
                    fmt::ptr(command.get()), command->command());
}

std::shared_ptr<TSYCommand> TSYCommandQueue::takeFirst() {
  const platform::MutexLock lock(monitor_);
  if (commands_.empty()) return nullptr;
  std::shared_ptr<TSYCommand> first = std::move(commands_.front());
  commands_.pop_front();
  return first;
}

TSYResult<void> TSYCommandQueue::executeNextCommand() {
  const std::shared_ptr<TSYCommand> command = takeFirst();
  if (!command) return TSYFailure(TSYErrorCreate(TSYErrorQueueEmpty, std::nullopt, TSYLogIt::no));
  return execute(*command);
}

TSYResult<void> TSYCommandQueue::execute(TSYCommand& command) {
  return queue_.sync([&]() -> TSYResult<void> {
    TSYSystemLogWrite(TSYChannel::unspecified, LogLevel::info, "Executing command <{}; {}>...",
                      fmt::ptr(&command), command.command());
    TSYResult<void> result = command.fromQueueExecute(*this);
    TSYSystemLogWrite(TSYChannel::unspecified, LogLevel::info,
                      "Completed command <{}; {}>: success = {:d}, error = {}", fmt::ptr(&command),
                      command.command(), result.has_value(),
                      result ? uint64_t{TSYErrorSuccess} : result.error().code());
    return result;
  });
}

TSYResult<void> TSYCommandQueue::executeAllUntilExhausted() {
  while (const std::shared_ptr<TSYCommand> command = takeFirst()) {
    if (auto result = execute(*command); !result) return result;
  }
  return {};
}

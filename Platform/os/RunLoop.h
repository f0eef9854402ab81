// The main thread's loop: signals, file watches and the main queue.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "Platform/base/Errno.h"

namespace platform {

class RunLoop {
 public:
  RunLoop();
  ~RunLoop();
  RunLoop(const RunLoop&) = delete;
  RunLoop& operator=(const RunLoop&) = delete;

  // Runs until stop() is called. On the main thread.
  void run();
  // Ends run() after the work that is in hand. Any thread.
  void stop();
  // Runs `work` on the main thread: the main queue. In order, any thread.
  void async(std::function<void()> work);
  // Calls `handler` on the main thread when the descriptor is readable. The caller keeps the
  // descriptor open as long as the loop lives.
  Result<void> watchDescriptor(int descriptor, std::function<void()> handler);
  // Calls `handler` on the main thread after `name` in `directory` was written, renamed into place
  // or removed. The directory must exist. `directory` is a path outside any user's reach.
  Result<void> watchFile(const std::string& directory, const std::string& name,
                         std::function<void()> handler);
  // Calls `handler` on the main thread for a signal. Call it before any thread is started: it
  // blocks the signal, and threads inherit that.
  Result<void> watchSignal(int signal, std::function<void()> handler);
  // Calls `handler` on the main thread every `seconds`.
  Result<void> every(unsigned seconds, std::function<void()> handler);

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace platform

// Everything the loop waits for is a descriptor in one epoll set, with a handler each: signalfd and
// timerfd for signals and intervals, one inotify descriptor for all file watches, one eventfd for
// the main queue. Sources are only ever added, by any thread; handlers run on the main thread and
// never under a lock.
#include "Platform/os/RunLoop.h"

#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/signalfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cstdlib>
#include <deque>
#include <set>
#include <unordered_map>
#include <vector>

#include "Platform/base/FileDescriptor.h"
#include "Platform/base/Mutex.h"
#include "Platform/os/PlatformLog.h"

namespace platform {
namespace {

using Handler = std::function<void()>;

// A name in a watched directory.
struct FileWatch {
  int directory;  // inotify's number of it
  std::string name;
  std::shared_ptr<const Handler> handler;
};

constexpr uint32_t kChanges =
    IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE | IN_ONLYDIR | IN_DONT_FOLLOW;

void require(bool condition, const char* what) {
  if (condition) return;
  platformLog(LogLevel::fault, "RunLoop::RunLoop", "{}: {}", what, Errno{errno}.message());
  std::abort();
}

// What one read of inotify's descriptor tells.
struct FileChanges {
  std::set<std::pair<int, std::string>> names;  // with inotify's number of their directory
  bool overflow = false;                        // there were more
};

FileChanges readFileChanges(int inotify) {
  FileChanges changes;
  alignas(inotify_event) std::array<char, 16 * 1024> buffer;
  const ssize_t length = ::read(inotify, buffer.data(), buffer.size());
  for (ssize_t offset = 0; offset < length;) {
    const auto* const event = reinterpret_cast<const inotify_event*>(buffer.data() + offset);
    if ((event->mask & IN_Q_OVERFLOW) != 0) changes.overflow = true;
    // The kernel pads the name with zeros.
    if (event->len > 0) changes.names.emplace(event->wd, std::string(event->name));
    offset += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
  }
  return changes;
}

// Takes the 8-byte count out of an eventfd or a timerfd.
void drain(int descriptor) {
  uint64_t count = 0;
  while (::read(descriptor, &count, sizeof count) < 0 && errno == EINTR) {
  }
}

}  // namespace

struct RunLoop::State {
  FileDescriptor epoll{::epoll_create1(EPOLL_CLOEXEC)};
  FileDescriptor wakeUp{::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
  FileDescriptor inotify{::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)};
  std::atomic<bool> stopped = false;

  Mutex mutex;
  std::deque<Handler> mainQueue GUARDED_BY(mutex);
  std::unordered_map<int, std::shared_ptr<const Handler>> sources GUARDED_BY(mutex);
  std::vector<FileWatch> fileWatches GUARDED_BY(mutex);
  std::vector<FileDescriptor> ownDescriptors GUARDED_BY(mutex);

  Result<void> add(int descriptor, Handler handler);
  Result<void> addOwn(FileDescriptor descriptor, Handler handler);
  void wake();
  void dispatch(int descriptor);
  void runMainQueue();
  void deliverFileChanges();
};

Result<void> RunLoop::State::add(int descriptor, Handler handler) {
  const MutexLock lock(mutex);
  // First: the loop may see the descriptor before epoll_ctl has returned.
  const auto [source, isNew] =
      sources.emplace(descriptor, std::make_shared<const Handler>(std::move(handler)));
  if (!isNew) return failWith(EEXIST);
  epoll_event event{.events = EPOLLIN, .data = {.fd = descriptor}};
  if (::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, descriptor, &event) == 0) return {};
  const auto failure = lastErrno();
  sources.erase(source);
  return failure;
}

// The descriptor lives as long as the loop.
Result<void> RunLoop::State::addOwn(FileDescriptor descriptor, Handler handler) {
  if (!descriptor.valid()) return lastErrno();
  auto added = add(descriptor.get(), std::move(handler));
  const MutexLock lock(mutex);
  if (added) ownDescriptors.push_back(std::move(descriptor));
  return added;
}

void RunLoop::State::wake() {
  const uint64_t one = 1;
  // EAGAIN: the counter is full, so the loop is being woken already.
  [[maybe_unused]] const ssize_t count = ::write(wakeUp.get(), &one, sizeof one);
}

void RunLoop::State::dispatch(int descriptor) {
  std::shared_ptr<const Handler> handler;
  {
    const MutexLock lock(mutex);
    const auto source = sources.find(descriptor);
    if (source != sources.end()) handler = source->second;
  }
  if (handler) (*handler)();
}

// What the work adds waits for the next turn, so that the other sources get theirs.
void RunLoop::State::runMainQueue() {
  drain(wakeUp.get());
  std::deque<Handler> work;
  {
    const MutexLock lock(mutex);
    work.swap(mainQueue);
  }
  for (const Handler& piece : work) piece();
}

// One call of a handler for all changes that were read together.
void RunLoop::State::deliverFileChanges() {
  const FileChanges changes = readFileChanges(inotify.get());
  std::vector<std::shared_ptr<const Handler>> handlers;
  {
    const MutexLock lock(mutex);
    for (const FileWatch& watch : fileWatches) {
      if (changes.overflow || changes.names.contains({watch.directory, watch.name})) {
        handlers.push_back(watch.handler);
      }
    }
  }
  for (const auto& handler : handlers) (*handler)();
}

RunLoop::RunLoop() : state_(std::make_unique<State>()) {
  State* const state = state_.get();
  require(state->epoll.valid() && state->wakeUp.valid() && state->inotify.valid(),
          "no descriptors for the run loop");
  require(
      state->add(state->wakeUp.get(), [state] { state->runMainQueue(); }).has_value() &&
          state->add(state->inotify.get(), [state] { state->deliverFileChanges(); }).has_value(),
      "epoll");
}

RunLoop::~RunLoop() = default;

void RunLoop::run() {
  std::array<epoll_event, 16> events{};
  while (!state_->stopped.exchange(false)) {
    const int count = ::epoll_wait(state_->epoll.get(), events.data(),
                                   static_cast<int>(events.size()), /*timeout=*/-1);
    for (int i = 0; i < count; ++i) state_->dispatch(events[static_cast<size_t>(i)].data.fd);
  }
}

void RunLoop::stop() {
  state_->stopped = true;
  state_->wake();
}

void RunLoop::async(std::function<void()> work) {
  {
    const MutexLock lock(state_->mutex);
    state_->mainQueue.push_back(std::move(work));
  }
  state_->wake();
}

Result<void> RunLoop::watchDescriptor(int descriptor, std::function<void()> handler) {
  return state_->add(descriptor, std::move(handler));
}

Result<void> RunLoop::watchFile(const std::string& directory, const std::string& name,
                                std::function<void()> handler) {
  // Under the lock: an event is only looked up once its watch is in the table.
  const MutexLock lock(state_->mutex);
  const int watch = ::inotify_add_watch(state_->inotify.get(), directory.c_str(), kChanges);
  if (watch < 0) return lastErrno();
  state_->fileWatches.push_back({watch, name, std::make_shared<const Handler>(std::move(handler))});
  return {};
}

Result<void> RunLoop::watchSignal(int signal, std::function<void()> handler) {
  sigset_t signals;
  ::sigemptyset(&signals);
  if (::sigaddset(&signals, signal) != 0) return lastErrno();
  if (const int error = ::pthread_sigmask(SIG_BLOCK, &signals, nullptr); error != 0) {
    return failWith(error);
  }
  const int descriptor = ::signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK);
  return state_->addOwn(FileDescriptor(descriptor), [descriptor, handler = std::move(handler)] {
    signalfd_siginfo info{};
    if (::read(descriptor, &info, sizeof info) == sizeof info) handler();
  });
}

Result<void> RunLoop::every(unsigned seconds, std::function<void()> handler) {
  if (seconds == 0) return failWith(EINVAL);  // a timer of 0 never fires
  const int descriptor = ::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK);
  const itimerspec times{.it_interval = {.tv_sec = seconds, .tv_nsec = 0},
                         .it_value = {.tv_sec = seconds, .tv_nsec = 0}};
  FileDescriptor timer(descriptor);
  if (!timer.valid() || ::timerfd_settime(descriptor, 0, &times, nullptr) != 0) return lastErrno();
  return state_->addOwn(std::move(timer), [descriptor, handler = std::move(handler)] {
    drain(descriptor);
    handler();
  });
}

}  // namespace platform

#include "Platform/ipc/server/ServerCore.h"

#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/timerfd.h>

#include <algorithm>
#include <exception>
#include <utility>

namespace platform::ipc {
namespace {

constexpr uint64_t kListenerToken = 0;
constexpr uint64_t kTimerToken = 1;
constexpr uint64_t kFirstConnectionToken = 2;

// Connections that are accepted before the others get their turn.
constexpr int kAcceptedAtOnce = 64;
// How long nothing is accepted after the process or the system has run out of something, and how
// often waiting connections are looked after at most.
constexpr std::chrono::milliseconds kHousekeeping{250};

// Errors of the connection that was to be accepted, not of the listening socket.
bool concernsOnePeer(int error) {
  return error == ECONNABORTED || error == EINTR || error == EPROTO || error == EPERM;
}

}  // namespace

ServerCore::ServerCore(FileDescriptor listener, const Tasks& tasks, const SystemLog& log,
                       SerialQueue& acceptQueue, Server::Handler handler, Limits limits)
    : tasks_(tasks),
      log_(log),
      acceptQueue_(acceptQueue),
      handler_(std::move(handler)),
      limits_(limits),
      accounts_(limits),
      listener_(std::move(listener)),
      nextToken_(kFirstConnectionToken),
      pool_(limits.workers, log,
            [this](uint64_t token, std::span<uint8_t> scratch) { takeEvent(token, scratch); }) {}

Result<void> ServerCore::open() {
  if (const auto opened = pool_.open(); !opened) return opened;
  timer_ = FileDescriptor(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
  if (!timer_.valid()) return lastErrno();
  if (const auto added = pool_.add(timer_.get(), kTimerToken, EPOLLIN); !added) return added;
  const MutexLock lock(mutex_);
  return pool_.add(listener_.get(), kListenerToken, 0);
}

void ServerCore::resume() {
  acceptQueue_.assertCurrent();
  pool_.start();
  armListener();
}

bool ServerCore::drain(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  draining_ = true;
  const MutexLock lock(mutex_);
  closeListener();
  while (work_ != 0) {
    const auto left =
        std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    workEnded_.waitFor(mutex_, left);
  }
  return true;
}

void ServerCore::stop() {
  pool_.stop();
  std::vector<std::shared_ptr<ServerConnection>> connections;
  {
    const MutexLock lock(mutex_);
    closeListener();
    for (const auto& [token, connection] : connections_) connections.push_back(connection);
  }
  for (const auto& connection : connections) connection->end("");
}

// Not only closed: the service manager may hold the same socket, and its events would go on.
void ServerCore::closeListener() {
  if (!listener_.valid()) return;
  pool_.remove(listener_.get());
  listener_.reset();
}

void ServerCore::endWork() {
  if (--work_ != 0 || !draining_) return;
  const MutexLock lock(mutex_);
  workEnded_.notifyAll();
}

void ServerCore::takeEvent(uint64_t token, std::span<uint8_t> scratch) {
  if (token == kTimerToken) return keepHouse();
  if (token == kListenerToken) return acceptQueue_.sync([this] { acceptPending(); });
  serve(token, scratch);
}

void ServerCore::serve(uint64_t token, std::span<uint8_t> scratch) {
  std::shared_ptr<ServerConnection> connection;
  {
    const MutexLock lock(mutex_);
    const auto found = connections_.find(token);
    if (found == connections_.end()) return;  // ended since the event
    connection = found->second;
  }
  connection->serve(scratch);
}

void ServerCore::acceptPending() {
  for (int count = 0; count < kAcceptedAtOnce; ++count) {
    if (!acceptOne()) return;
  }
  armListener();
}

// Returns false when there is no more to accept for now; the listener is then armed, or will be.
bool ServerCore::acceptOne() {
  FileDescriptor socket = acceptSocket();
  const int error = errno;
  if (socket.valid()) {
    try {
      admit(std::move(socket));
    } catch (const std::exception& exception) {
      log(LogLevel::error, __func__, fmt::format("connection refused: {}", exception.what()));
    }
    return true;
  }
  if (concernsOnePeer(error)) return true;
  error == EAGAIN ? armListener() : pauseAccepting(error);
  return false;
}

// An invalid descriptor and errno when there is none; EAGAIN when nothing is accepted any more.
FileDescriptor ServerCore::acceptSocket() {
  const MutexLock lock(mutex_);
  if (!listener_.valid()) {
    errno = EAGAIN;
    return {};
  }
  FileDescriptor socket(::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC));
  if (socket.valid()) shortageLogged_ = false;
  return socket;
}

void ServerCore::admit(FileDescriptor socket) {
  auto peer = identifyPeer(socket.get(), tasks_);
  if (!peer) {
    return log(LogLevel::error, __func__,
               fmt::format("connection refused: its process cannot be identified: {}",
                           peer.error().message()));
  }
  auto account = accounts_.admit(peer->uid());
  if (account == nullptr) {
    return log(
        LogLevel::error, __func__,
        fmt::format("connection of pid {} refused: uid {} has too many", peer->pid(), peer->uid()));
  }
  std::shared_ptr<ServerConnection> connection;
  {
    const MutexLock lock(mutex_);
    const uint64_t token = nextToken_++;
    connection = std::make_shared<ServerConnection>(shared_from_this(), token, std::move(socket),
                                                    std::move(*peer), std::move(account));
    connections_.emplace(token, connection);
  }
  const auto added = pool_.add(connection->descriptor(), connection->token(), EPOLLIN);
  if (!added) connection->end(fmt::format("it cannot be watched: {}", added.error().message()));
}

// Out of descriptors or memory: the listening socket stays readable, so it is left alone for a
// while. One line tells of it until something is accepted again.
void ServerCore::pauseAccepting(int error) {
  bool isNew = false;
  {
    const MutexLock lock(mutex_);
    acceptingPaused_ = true;
    isNew = !std::exchange(shortageLogged_, true);
    setTimer(/*running=*/true);
  }
  if (isNew) {
    log(LogLevel::error, __func__,
        fmt::format("accepting connections pauses: {}", Errno{error}.message()));
  }
}

void ServerCore::armListener() {
  const MutexLock lock(mutex_);
  if (listener_.valid()) pool_.arm(listener_.get(), kListenerToken, EPOLLIN);
}

void ServerCore::watch(uint64_t token) {
  const MutexLock lock(mutex_);
  watched_.insert(token);
  setTimer(/*running=*/true);
}

void ServerCore::unwatch(uint64_t token) {
  const MutexLock lock(mutex_);
  watched_.erase(token);
}

void ServerCore::forget(uint64_t token) {
  const MutexLock lock(mutex_);
  watched_.erase(token);
  connections_.erase(token);
}

// The timer runs only while somebody waits: an idle service sleeps.
void ServerCore::setTimer(bool running) {
  if (std::exchange(timerRuns_, running) == running) return;
  const auto period = std::clamp(limits_.progress / 8, std::chrono::milliseconds(1), kHousekeeping);
  const timespec time = {
      .tv_sec = 0, .tv_nsec = std::chrono::nanoseconds(running ? period : period * 0).count()};
  const itimerspec setting = {.it_interval = time, .it_value = time};
  ::timerfd_settime(timer_.get(), 0, &setting, nullptr);
}

void ServerCore::keepHouse() {
  uint64_t expirations = 0;
  while (::read(timer_.get(), &expirations, sizeof expirations) < 0 && errno == EINTR) {
  }
  std::vector<std::shared_ptr<ServerConnection>> waiting;
  bool wasPaused = false;
  {
    const MutexLock lock(mutex_);
    for (const uint64_t token : watched_) waiting.push_back(connections_.at(token));
    wasPaused = std::exchange(acceptingPaused_, false);
  }
  if (wasPaused) armListener();
  const auto deadline = ServerConnection::Clock::now() - limits_.progress;
  for (const auto& connection : waiting) connection->endIfStalledSince(deadline);

  const MutexLock lock(mutex_);
  if (watched_.empty() && !acceptingPaused_) setTimer(/*running=*/false);
  pool_.arm(timer_.get(), kTimerToken, EPOLLIN);
}

}  // namespace platform::ipc

#include "Platform/ipc/server/ServerConnection.h"

#include <fmt/format.h>
#include <sys/socket.h>

#include <exception>
#include <utility>

#include "Platform/ipc/server/ServerCore.h"

namespace platform::ipc {
namespace {

// Reads before others get their turn.
constexpr int kReadsPerTurn = 64;
// How long a turn waits for more while other workers are free. A client that has its reply often
// sends its next request at once, and a worker that waits for it on the socket itself is woken
// sooner than one that epoll chooses, mostly on another processor. The kernel rounds the time up to
// its clock's next tick.
constexpr timeval kLingering = {.tv_sec = 0, .tv_usec = 1'000};

bool isOnlyNotNow(int error) {
  return error == EAGAIN || error == EINTR;
}

}  // namespace

ServerConnection::ServerConnection(std::shared_ptr<ServerCore> core, uint64_t token,
                                   FileDescriptor socket, Peer peer,
                                   std::shared_ptr<UserAccount> account)
    : core_(std::move(core)),
      token_(token),
      peer_(std::move(peer)),
      account_(std::move(account)),
      socket_(std::move(socket)),
      inputCharge_(*account_),
      outputCharge_(*account_) {
  ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &kLingering, sizeof kLingering);
}

ServerConnection::~ServerConnection() = default;

void ServerConnection::serve(std::span<uint8_t> scratch) {
  if (!beginTurn()) return;
  try {
    takeFrames();
    for (int reads = 0; reads < kReadsPerTurn && mayTakeFrame() && readOnce(scratch);) ++reads;
  } catch (const std::exception& exception) {
    end(fmt::format("an exception in a handler: {}", exception.what()));
  } catch (...) {
    end("an unknown exception in a handler");
  }
  endTurn();
}

// Returns false when there is nothing to do. A reply that had to wait arms the connection even when
// an event is on its way to a worker, so that two may come; the turn that is on covers both.
bool ServerConnection::beginTurn() {
  const MutexLock lock(mutex_);
  if (ended_ || onTurn_) return false;
  onTurn_ = true;
  core_->beginWork();
  progress_ = false;
  if (hasOutput()) flush();
  return true;
}

void ServerConnection::endTurn() {
  {
    const MutexLock lock(mutex_);
    onTurn_ = false;
    if (ended_) {
      finish();
    } else {
      if (progress_) lastProgress_ = Clock::now();
      if (hasOutput() || !input_.empty()) watch();
      if (hasOutput() || !core_->draining()) {
        core_->pool().arm(socket_.get(), token_, hasOutput() ? EPOLLOUT : EPOLLIN);
      }
    }
  }
  core_->endWork();
}

// Frames are taken one by one, and none while a reply waits.
bool ServerConnection::mayTakeFrame() {
  const MutexLock lock(mutex_);
  return !ended_ && !hasOutput() && !core_->draining();
}

// Returns whether something came.
bool ServerConnection::readOnce(std::span<uint8_t> scratch) {
  const int flags = core_->pool().hasFreeWorker() ? 0 : MSG_DONTWAIT;
  const ssize_t count = ::recv(socket_.get(), scratch.data(), scratch.size(), flags);
  if (count < 0 && isOnlyNotNow(errno)) return false;
  if (count <= 0) {
    end(count < 0 || input_.empty() ? "" : "the peer closed it in the middle of a frame");
    return false;
  }
  progress_ = true;

  const std::span<const uint8_t> bytes = scratch.first(static_cast<size_t>(count));
  if (input_.empty() && mayTakeFrame()) {
    // Whole frames, the usual case, are handled where they were read.
    keepInput(bytes.subspan(handleFrames(bytes)));
  } else {
    keepInput(bytes);
    takeFrames();
  }
  return true;
}

void ServerConnection::keepInput(std::span<const uint8_t> bytes) {
  if (bytes.empty()) return;
  if (!inputCharge_.set(input_.size() + bytes.size())) return end("its user's buffers are full");
  input_.insert(input_.end(), bytes.begin(), bytes.end());
}

// Handles the frames that are whole by now.
void ServerConnection::takeFrames() {
  if (input_.empty() || !mayTakeFrame()) return;
  const size_t handled = handleFrames(input_);
  if (handled == input_.size()) {
    input_ = {};  // an idle connection holds no memory
  } else {
    input_.erase(input_.begin(), input_.begin() + static_cast<ptrdiff_t>(handled));
  }
  inputCharge_.set(input_.size());
}

// Returns how many bytes were whole frames that have been handled.
size_t ServerConnection::handleFrames(std::span<const uint8_t> bytes) {
  size_t handled = 0;
  while (bytes.size() - handled >= kFrameHeaderSize) {
    const std::span<const uint8_t> rest = bytes.subspan(handled);
    const auto header = decodeHeader(rest.first<kFrameHeaderSize>());
    if (!header) {
      end(header.error().reason);
      break;
    }
    if (header->flags != 0) {
      end("a request with the flags of a reply");
      break;
    }
    if (rest.size() - kFrameHeaderSize < header->bodyLength) break;
    handleFrame(*header, rest.subspan(kFrameHeaderSize, header->bodyLength));
    handled += kFrameHeaderSize + header->bodyLength;
    if (handled == bytes.size() || !mayTakeFrame()) break;
  }
  return handled;
}

void ServerConnection::handleFrame(const FrameHeader& header, std::span<const uint8_t> body) {
  auto message = decodeMessage(body);
  if (!message) return end("a malformed message: " + message.error().reason);
  std::optional<ReplyPort> reply;
  if (header.sequence != 0) reply.emplace(shared_from_this(), header.sequence);
  core_->handle({.connection = ConnectionHandle(shared_from_this()),
                 .message = std::move(*message),
                 .reply = std::move(reply)});
}

void ServerConnection::send(std::vector<uint8_t> frame) {
  const MutexLock lock(mutex_);
  if (ended_) return;
  std::span<const uint8_t> rest(frame);
  if (!hasOutput() && !sendNow(rest)) return;
  if (rest.empty()) return;
  const size_t alreadySent = frame.size() - rest.size();
  keep(std::move(frame), alreadySent);
  if (ended_ || onTurn_) return;
  watch();
  core_->pool().arm(socket_.get(), token_, EPOLLOUT);
}

// Sends what the socket takes at once, and leaves the rest in `bytes`. Returns false when the
// connection has ended.
bool ServerConnection::sendNow(std::span<const uint8_t>& bytes) {
  while (!bytes.empty()) {
    const ssize_t count =
        ::send(socket_.get(), bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0 && errno == EAGAIN) break;
    if (count < 0) {
      endLocked("");
      return false;
    }
    bytes = bytes.subspan(static_cast<size_t>(count));
  }
  return true;
}

void ServerConnection::flush() {
  std::span<const uint8_t> rest = std::span(output_).subspan(sent_);
  const size_t before = rest.size();
  if (!sendNow(rest)) return;
  if (rest.size() < before) progress_ = true;
  if (rest.empty()) return dropOutput();
  sent_ = output_.size() - rest.size();
}

void ServerConnection::keep(std::vector<uint8_t> frame, size_t alreadySent) {
  if (!outputCharge_.set(output_.size() + frame.size())) {
    return endLocked("its user's buffers are full");
  }
  if (hasOutput()) {
    output_.insert(output_.end(), frame.begin(), frame.end());
    return;
  }
  output_ = std::move(frame);
  sent_ = alreadySent;
  lastProgress_ = Clock::now();
  core_->beginWork();  // until it is out
}

void ServerConnection::dropOutput() {
  if (!hasOutput()) return;
  output_ = {};
  sent_ = 0;
  outputCharge_.set(0);
  core_->endWork();
}

// Lets the core ask from time to time whether the peer makes progress.
void ServerConnection::watch() {
  if (!std::exchange(watched_, true)) core_->watch(token_);
}

void ServerConnection::endIfStalledSince(Clock::time_point deadline) {
  const MutexLock lock(mutex_);
  if (ended_ || onTurn_ || !watched_) return;  // a handler that takes long is not the peer's fault
  if (!hasOutput() && input_.empty()) {
    watched_ = false;
    core_->unwatch(token_);
  } else if (lastProgress_ < deadline) {
    endLocked("the peer makes no progress");
  }
}

void ServerConnection::end(const std::string& reason) {
  const MutexLock lock(mutex_);
  endLocked(reason);
}

void ServerConnection::endLocked(const std::string& reason) {
  if (std::exchange(ended_, true)) return;
  if (!reason.empty()) {
    core_->log(
        LogLevel::error, __func__,
        fmt::format("connection of pid {} (uid {}) ended: {}", peer_.pid(), peer_.uid(), reason));
  }
  dropOutput();
  ::shutdown(socket_.get(), SHUT_RDWR);
  if (!onTurn_) finish();
}

void ServerConnection::finish() {
  core_->pool().remove(socket_.get());
  socket_.reset();
  input_ = {};
  inputCharge_.set(0);
  core_->forget(token_);
}

}  // namespace platform::ipc

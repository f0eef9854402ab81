// A server under a fresh root, and clients that can do what Channel never would.
#pragma once

#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/time.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "Platform/ipc/Codec.h"
#include "Platform/ipc/SocketPath.h"
#include "Platform/ipc/server/Server.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform::ipc {

using namespace std::chrono_literals;

inline constexpr auto kPatience = 20s;  // until a test gives up

// Whether `condition` comes true.
template <typename Condition>
bool eventually(Condition condition) {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(1ms);
  }
  return true;
}

// Holds handlers up until it is opened.
class Gate {
 public:
  void pass() {
    ++waiting_;
    while (!open_) std::this_thread::sleep_for(1ms);
  }
  void open() { open_ = true; }
  bool hasWaiting(int count) const { return waiting_ == count; }

 private:
  std::atomic<int> waiting_ = 0;
  std::atomic<bool> open_ = false;
};

// A request with a "Number", which the tests tell requests apart by.
inline std::vector<uint8_t> requestFrame(uint64_t number, uint32_t sequence) {
  Message message;
  message.set("Number", number);
  return encodeFrame(message, sequence, 0).value();
}

struct ReceivedReply {
  uint32_t sequence;
  Message message;
};

class RawClient {
 public:
  explicit RawClient(const std::string& path) : socket_(connectTo(path, SOCK_STREAM).value()) {
    const timeval patience = {.tv_sec = std::chrono::seconds(kPatience).count(), .tv_usec = 0};
    ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  }

  int descriptor() const { return socket_.get(); }
  void close() { socket_.reset(); }

  // Returns how much the socket took without waiting; nothing when the connection has ended.
  size_t send(std::span<const uint8_t> bytes) {
    size_t sent = 0;
    while (sent < bytes.size()) {
      const ssize_t count = ::send(socket_.get(), bytes.data() + sent, bytes.size() - sent,
                                   MSG_NOSIGNAL | MSG_DONTWAIT);
      if (count < 0) break;
      sent += static_cast<size_t>(count);
    }
    return sent;
  }
  void request(uint64_t number, uint32_t sequence) {
    const auto frame = requestFrame(number, sequence);
    EXPECT_EQ(send(frame), frame.size());
  }

  // Nothing when the connection ends, or nothing comes.
  std::optional<ReceivedReply> receive() {
    std::array<uint8_t, kFrameHeaderSize> bytes{};
    if (!readAll(bytes)) return std::nullopt;
    const auto header = decodeHeader(bytes);
    if (!header || header->flags != kReplyFlag) return std::nullopt;
    std::vector<uint8_t> body(header->bodyLength);
    if (!readAll(body)) return std::nullopt;
    auto message = decodeMessage(body);
    if (!message) return std::nullopt;
    return ReceivedReply{.sequence = header->sequence, .message = std::move(*message)};
  }
  // Whether the service ends the connection without another byte.
  bool isEnded() {
    uint8_t byte = 0;
    const ssize_t count = ::recv(socket_.get(), &byte, 1, 0);
    return count == 0 || (count < 0 && errno == ECONNRESET);
  }
  bool isOpen() {
    uint8_t byte = 0;
    return ::recv(socket_.get(), &byte, 1, MSG_DONTWAIT | MSG_PEEK) < 0 && errno == EAGAIN;
  }
  // Whether the service has read all that was sent.
  bool isAllRead() const {
    int waiting = -1;
    return ::ioctl(socket_.get(), TIOCOUTQ, &waiting) == 0 && waiting == 0;
  }

 private:
  bool readAll(std::span<uint8_t> target) {
    return target.empty() || ::recv(socket_.get(), target.data(), target.size(), MSG_WAITALL) ==
                                 static_cast<ssize_t>(target.size());
  }

  FileDescriptor socket_;
};

class ServerTest : public testing::Test {
 protected:
  void TearDown() override { gate_.open(); }

  static void echo(Request request) { std::move(*request.reply).send(request.message); }

  std::string socketPath() const { return root_.path("run/tessary/service"); }
  RawClient connect() const { return RawClient(socketPath()); }

  void start(Server::Handler handler, Limits limits = {}, FileDescriptor activated = {}) {
    server_ = std::move(Server::create(socketPath(), std::move(activated), tasks_, log_,
                                       acceptQueue_, std::move(handler), limits)
                            .value());
    acceptQueue_.sync([this] { server_->resume(); });
  }

  // Whether a client gets its request answered by echo().
  static bool isServed(RawClient& client) {
    client.request(1, 1);
    const auto reply = client.receive();
    return reply && reply->sequence == 1;
  }

  TestRoot root_;
  Tasks tasks_{root_.files()};
  const SystemLog log_{LogLevel::standard, /*journal=*/false};
  SerialQueue acceptQueue_{"accept"};
  Gate gate_;
  std::unique_ptr<Server> server_;
};

}  // namespace platform::ipc

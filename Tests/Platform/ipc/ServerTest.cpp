// The server, and clients that can do what Channel never would.
#include "Platform/ipc/server/Server.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <ctime>
#include <stdexcept>
#include <thread>

#include "Platform/ipc/Codec.h"
#include "Platform/ipc/SocketPath.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform::ipc {
namespace {

using namespace std::chrono_literals;

constexpr auto kPatience = 20s;  // until a test gives up

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
std::vector<uint8_t> requestFrame(uint64_t number, uint32_t sequence) {
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

  void start(Server::Handler handler, Limits limits = {}) {
    server_ = std::move(Server::create(socketPath(), /*activated=*/{}, tasks_, log_, acceptQueue_,
                                       std::move(handler), limits)
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

uint64_t numberOf(const Request& request) {
  return request.message.uint64("Number").value_or(0);
}

TEST_F(ServerTest, AnswersRequestsInOrderHoweverTheyArrive) {
  start(echo);
  std::vector<uint8_t> bytes = requestFrame(1, 0xFFFFFFFF);
  const auto second = requestFrame(2, 12);
  bytes.insert(bytes.end(), second.begin(), second.end());
  for (const size_t piece : {bytes.size(), bytes.size() - 3, size_t{1}}) {
    RawClient client = connect();
    for (size_t start = 0; start < bytes.size(); start += piece) {
      client.send(std::span(bytes).subspan(start, std::min(piece, bytes.size() - start)));
      if (piece == 1) std::this_thread::sleep_for(100us);
    }
    for (const uint32_t sequence : {0xFFFFFFFFU, 12U}) {
      const auto reply = client.receive();
      ASSERT_TRUE(reply) << piece;
      EXPECT_EQ(reply->sequence, sequence);
    }
  }
}

TEST_F(ServerTest, DeferredRepliesMayBeOvertaken) {
  Mutex mutex;
  std::optional<ReplyPort> kept;
  start([&](Request request) {
    if (numberOf(request) != 1) return echo(std::move(request));
    const MutexLock lock(mutex);
    kept = std::move(request.reply);
  });
  RawClient client = connect();
  const auto deferOne = [&] {
    client.request(1, 1);
    ASSERT_TRUE(eventually([&] {
      const MutexLock lock(mutex);
      return kept.has_value();
    }));
  };
  for (uint32_t round = 0; round < 200; ++round) {
    deferOne();
    std::thread later([&] {
      const MutexLock lock(mutex);
      std::move(*kept).send(Message());
      kept.reset();
    });
    client.request(2, 2);
    const uint32_t first = client.receive().value().sequence;
    EXPECT_EQ(first + client.receive().value().sequence, 3U);
    later.join();
  }
  // One that is left over is dropped with the server, and one that is kept longer does nothing.
  deferOne();
  server_.reset();
  EXPECT_TRUE(client.isEnded());
  std::move(*kept).send(Message());
}

TEST_F(ServerTest, RepliesOverTheLimitBecomeAnError) {
  start([](Request request) {
    request.message.set("Load", Value::Data(kMaximumBodySize));
    echo(std::move(request));
  });
  RawClient client = connect();
  client.request(1, 5);
  EXPECT_EQ(client.receive().value().message.values(), (Value::Dictionary{{"ReplyError", 73U}}));
}

TEST_F(ServerTest, EndsConnectionsWithoutProgress) {
  start(
      [](Request request) {
        request.message.set("Load", Value::Data(1'000'000));
        echo(std::move(request));
      },
      {.progress = 500ms});
  RawClient idle = connect();
  RawClient half = connect();
  RawClient slow = connect();
  RawClient deaf = connect();
  const auto frame = requestFrame(1, 1);
  half.send(std::span(frame).first(20));
  deaf.send(frame);
  for (size_t index = 0; index + 1 < frame.size(); ++index) {
    slow.send(std::span(frame).subspan(index, 1));
    std::this_thread::sleep_for(30ms);
  }
  EXPECT_TRUE(half.isEnded());
  EXPECT_FALSE(deaf.receive());  // cut off in the middle
  EXPECT_TRUE(idle.isOpen());
  slow.send(std::span(frame).last(1));
  EXPECT_TRUE(slow.receive());
}

TEST_F(ServerTest, HoldsUsersToTheirBytes) {
  start(echo, {.bufferedBytesOfUser = 300'000});
  RawClient first = connect();
  RawClient second = connect();
  Message large;
  large.set("Load", Value::Data(200'000));
  const auto frame = encodeFrame(large, 1, 0).value();
  // Until the service has read it, or given up.
  const auto isTaken = [&frame](RawClient& client, size_t size) {
    size_t sent = 0;
    return eventually([&] {
      sent += client.send(std::span(frame).subspan(sent, size - sent));
      return !client.isOpen() || (sent == size && client.isAllRead());
    });
  };
  EXPECT_TRUE(isTaken(first, frame.size() - 1));
  EXPECT_TRUE(isTaken(second, 150'000));
  EXPECT_TRUE(second.isEnded());
  first.send(std::span(frame).last(1));
  EXPECT_TRUE(first.receive());
}

TEST_F(ServerTest, SurvivesHandlersThatThrowAndPeersThatLeave) {
  start([this](Request request) {
    if (numberOf(request) == 2) throw std::runtime_error("on purpose");
    if (numberOf(request) == 3) throw 3;
    if (numberOf(request) == 4) gate_.pass();
    echo(std::move(request));
  });
  for (const uint64_t number : {2U, 3U}) {
    testing::internal::CaptureStderr();
    RawClient client = connect();
    client.request(number, 1);
    EXPECT_TRUE(client.isEnded());
    EXPECT_THAT(testing::internal::GetCapturedStderr(), testing::HasSubstr("exception"));
  }
  RawClient leaving = connect();
  leaving.request(4, 1);
  ASSERT_TRUE(eventually([&] { return gate_.hasWaiting(1); }));
  leaving.close();
  gate_.open();
  RawClient client = connect();
  EXPECT_TRUE(isServed(client));
}

TEST_F(ServerTest, BlockedHandlersDoNotStopTheOthers) {
  constexpr unsigned kWorkers = 4;
  start(
      [this](Request request) {
        if (numberOf(request) == 2) gate_.pass();
        echo(std::move(request));
      },
      {.workers = kWorkers});
  std::vector<RawClient> blocked;
  for (unsigned count = 1; count < kWorkers; ++count) {
    blocked.push_back(connect());
    blocked.back().request(2, 1);
  }
  ASSERT_TRUE(eventually([&] { return gate_.hasWaiting(kWorkers - 1); }));
  RawClient client = connect();
  EXPECT_TRUE(isServed(client));
  // With the last worker blocked nobody accepts; it goes on when one is free.
  client.request(2, 2);
  ASSERT_TRUE(eventually([&] { return gate_.hasWaiting(kWorkers); }));
  RawClient late = connect();
  late.request(1, 1);
  std::this_thread::sleep_for(20ms);
  EXPECT_TRUE(late.isOpen());
  gate_.open();
  EXPECT_TRUE(late.receive());
  for (RawClient& one : blocked) EXPECT_TRUE(one.receive());
}

TEST_F(ServerTest, DrainsWhatRunsAndTakesNothingMore) {
  start([this](Request request) {
    if (numberOf(request) == 2) gate_.pass();
    request.message.set("Load", Value::Data(1'000'000));
    echo(std::move(request));
  });
  RawClient running = connect();
  RawClient later = connect();
  running.request(2, 1);
  running.request(3, 2);
  ASSERT_TRUE(eventually([&] { return gate_.hasWaiting(1); }));
  EXPECT_FALSE(server_->drain(20ms));
  EXPECT_EQ(connectTo(socketPath(), SOCK_STREAM).error().value, ECONNREFUSED);
  gate_.open();
  later.request(4, 1);
  EXPECT_FALSE(server_->drain(20ms));  // the reply does not fit into the socket
  std::thread reader([&] { EXPECT_EQ(running.receive().value().sequence, 1U); });
  EXPECT_TRUE(server_->drain(kPatience));
  reader.join();
  EXPECT_TRUE(running.isOpen());
  EXPECT_TRUE(later.isOpen());
}

// While descriptors are short, nothing is accepted and no time is burnt; later it goes on.
TEST_F(ServerTest, WaitsForDescriptorsToComeBack) {
  if (kSanitizedStride > 1) GTEST_SKIP() << "the sanitizers' own checks need descriptors";
  start(echo);
  RawClient before = connect();
  ASSERT_TRUE(isServed(before));
  const FileDescriptor waiting(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  rlimit original{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &original), 0);
  const int lowestFree = ::dup(waiting.get());
  ::close(lowestFree);
  const rlimit tight = {.rlim_cur = static_cast<rlim_t>(lowestFree), .rlim_max = original.rlim_max};
  testing::internal::CaptureStderr();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &tight), 0);
  sockaddr_un address = {.sun_family = AF_UNIX, .sun_path = {}};
  ASSERT_LT(socketPath().size(), sizeof address.sun_path);
  std::ranges::copy(socketPath(), std::begin(address.sun_path));
  ASSERT_EQ(::connect(waiting.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  const std::clock_t cpu = std::clock();
  std::this_thread::sleep_for(700ms);
  EXPECT_LT(std::clock() - cpu, CLOCKS_PER_SEC / 5);
  EXPECT_TRUE(isServed(before));
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &original), 0);
  const auto frame = requestFrame(1, 1);
  ASSERT_EQ(::send(waiting.get(), frame.data(), frame.size(), 0),
            static_cast<ssize_t>(frame.size()));
  std::array<uint8_t, 64> reply{};
  EXPECT_GT(::recv(waiting.get(), reply.data(), reply.size(), 0), 0);
  const std::string log = testing::internal::GetCapturedStderr();
  EXPECT_EQ(std::ranges::count(log, '\n'), 1) << log;
}

}  // namespace
}  // namespace platform::ipc

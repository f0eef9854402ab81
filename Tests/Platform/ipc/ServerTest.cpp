#include "Platform/ipc/server/Server.h"

#include <gmock/gmock.h>
#include <sys/resource.h>
#include <sys/un.h>

#include <algorithm>
#include <ctime>
#include <stdexcept>

#include "Platform/ipc/Channel.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Platform/ipc/HexBytes.h"
#include "Tests/Platform/ipc/ServerFixture.h"

namespace platform::ipc {
namespace {

constexpr uint64_t kReplyTooLarge = 73;

uint64_t numberOf(const Request& request) {
  return request.message.uint64("Number").value_or(0);
}

std::vector<uint8_t> joined(std::initializer_list<std::vector<uint8_t>> parts) {
  std::vector<uint8_t> bytes;
  for (const auto& part : parts) bytes.insert(bytes.end(), part.begin(), part.end());
  return bytes;
}

TEST_F(ServerTest, AnswersRequestsInOrderHoweverTheyArrive) {
  start(echo);
  const auto bytes =
      joined({requestFrame(1, 11), requestFrame(2, 12), requestFrame(3, 0xFFFFFFFF)});
  for (const size_t piece : {bytes.size(), size_t{40}, size_t{1}}) {
    RawClient client = connect();
    for (size_t start = 0; start < bytes.size(); start += piece) {
      client.send(std::span(bytes).subspan(start, std::min(piece, bytes.size() - start)));
      if (piece == 1) std::this_thread::sleep_for(100us);
    }
    for (const uint32_t sequence : {11U, 12U, 0xFFFFFFFFU}) {
      const auto reply = client.receive();
      ASSERT_TRUE(reply) << piece;
      EXPECT_EQ(reply->sequence, sequence);
    }
  }
}

TEST_F(ServerTest, ServesManyClientsAndLargeMessages) {
  start(echo);
  std::vector<std::thread> clients;
  for (uint64_t client = 0; client < 8; ++client) {
    clients.emplace_back([this, client] {
      auto channel = Channel::connect(socketPath());
      ASSERT_TRUE(channel);
      for (uint64_t number = 0; number < 50; ++number) {
        Message request;
        request.set("Number", client * 1000 + number);
        request.set("Load", Value::Data(number % 10 == 0 ? 3'000'000 : 10, 0x5A));
        const auto reply = channel->call(request);
        ASSERT_TRUE(reply) << reply.error().reason;
        EXPECT_EQ(reply->values(), request.values());
      }
    });
  }
  for (std::thread& client : clients) client.join();
}

TEST_F(ServerTest, EndsConnectionsThatBreakTheProtocol) {
  std::atomic<int> handled = 0;
  start([&handled](Request request) {
    ++handled;
    echo(std::move(request));
  });
  const std::string ok = "54535931 01000000 01000000 00000000 a0";
  const struct {
    std::string hex;
    bool closes = false;  // the client closes its half afterwards
    int handled = 0;
  } cases[] = {
      {.hex = "54535932 01000000 01000000 00000000"},
      {.hex = "54535931 ffffffff 01000000 00000000"},
      {.hex = "54535931 01000001 01000000 00000000"},
      {.hex = "54535931 01000000 01000000 01000000 a0"},  // the flag of a reply
      {.hex = "54535931 01000000 01000000 00010000 a0"},
      {.hex = "54535931 00000000 01000000 00000000"},  // no body
      {.hex = "54535931 05000000 01000000 00000000 baffffffff"},
      {.hex = "54535931 02000000 01000000 00000000 a0a0"},
      {.hex = ok + "00" + std::string(30, '0'), .handled = 1},
      {.hex = "54535931 02000000 01000000 00000000 a0", .closes = true},
      {.hex = "545359", .closes = true},
  };
  RawClient bystander = connect();
  for (const auto& [hex, closes, expectedHandled] : cases) {
    handled = 0;
    testing::internal::CaptureStderr();
    RawClient client = connect();
    client.send(hexBytes(hex));
    if (closes) ::shutdown(client.descriptor(), SHUT_WR);
    EXPECT_TRUE(expectedHandled == 0 || client.receive());
    EXPECT_TRUE(client.isEnded()) << hex;
    const std::string log = testing::internal::GetCapturedStderr();
    EXPECT_EQ(std::ranges::count(log, '\n'), 1) << hex << ": " << log;
    EXPECT_EQ(handled, expectedHandled) << hex;
  }
  EXPECT_TRUE(isServed(bystander));
}

TEST_F(ServerTest, HandlerSeesThePeerAndMayCancel) {
  TaskRecord record;
  record.signingIdentifier = "com.veltra.exampleapp";
  const uint64_t startTime = processStartTime(::getpid()).value();
  ASSERT_TRUE(tasks_.write(::getpid(), startTime, record));
  std::atomic<bool> hadReply = true;
  start([&](Request request) {
    const Peer& peer = request.connection.peer();
    EXPECT_EQ(peer.token, AuditToken::make(::geteuid(), ::getegid(), ::getpid(), startTime));
    EXPECT_EQ(peer.task.value().signingIdentifier, "com.veltra.exampleapp");
    hadReply = request.reply.has_value();
    request.connection.cancel();
    if (request.reply) std::move(*request.reply).send(request.message);
  });
  for (const uint32_t sequence : {0U, 1U}) {
    RawClient client = connect();
    client.request(1, sequence);
    EXPECT_TRUE(client.isEnded());
    EXPECT_EQ(hadReply, sequence != 0);
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
  for (uint32_t round = 0; round < 200; ++round) {
    client.request(1, 2 * round + 1);
    ASSERT_TRUE(eventually([&] {
      const MutexLock lock(mutex);
      return kept.has_value();
    }));
    std::thread later([&] {
      const MutexLock lock(mutex);
      std::move(*kept).send(Message());
      kept.reset();
    });
    client.request(2, 2 * round + 2);
    std::vector<uint32_t> sequences;
    for (int reply = 0; reply < 2; ++reply) sequences.push_back(client.receive().value().sequence);
    EXPECT_THAT(sequences, testing::UnorderedElementsAre(2 * round + 1, 2 * round + 2));
    later.join();
  }
  // One that is left over is dropped with the server, and one that is kept longer does nothing.
  client.request(1, 1);
  ASSERT_TRUE(eventually([&] {
    const MutexLock lock(mutex);
    return kept.has_value();
  }));
  server_.reset();
  EXPECT_TRUE(client.isEnded());
  std::move(*kept).send(Message());
}

TEST_F(ServerTest, ReadsNothingMoreWhileRepliesWait) {
  constexpr uint64_t kRequests = 40;
  std::atomic<uint64_t> handled = 0;
  start([&handled](Request request) {
    request.message.set("Load", Value::Data(500'000));
    ++handled;
    echo(std::move(request));
  });
  RawClient client = connect();
  std::vector<uint8_t> requests;
  for (uint32_t number = 1; number <= kRequests; ++number) {
    requests = joined({requests, requestFrame(number, number)});
  }
  client.send(requests);
  ASSERT_TRUE(eventually([&] { return handled > 0; }));
  std::this_thread::sleep_for(50ms);
  EXPECT_LE(handled, 2U);
  for (uint32_t number = 1; number <= kRequests; ++number) {
    EXPECT_EQ(client.receive().value().sequence, number);
  }
  EXPECT_EQ(handled, kRequests);
}

TEST_F(ServerTest, KeptRepliesToASlowReaderArriveWhole) {
  Mutex mutex;
  std::vector<ReplyPort> kept;
  start([&](Request request) {
    const MutexLock lock(mutex);
    kept.push_back(std::move(*request.reply));
  });
  RawClient client = connect();
  for (uint32_t sequence = 1; sequence <= 8; ++sequence) client.request(1, sequence);
  ASSERT_TRUE(eventually([&] {
    const MutexLock lock(mutex);
    return kept.size() == 8;
  }));
  Message large;
  large.set("Load", Value::Data(500'000, 0x5A));
  std::vector<std::thread> senders;
  for (ReplyPort& port : kept) {
    senders.emplace_back([&port, &large] { std::move(port).send(large); });
  }
  for (std::thread& sender : senders) sender.join();
  for (int count = 0; count < 8; ++count) {
    EXPECT_EQ(client.receive().value().message.values(), large.values());
  }
}

TEST_F(ServerTest, RepliesOverTheLimitBecomeAnError) {
  start([](Request request) {
    request.message.set("Load", Value::Data(kMaximumBodySize));
    echo(std::move(request));
  });
  RawClient client = connect();
  client.request(1, 5);
  const auto reply = client.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->sequence, 5U);
  EXPECT_EQ(reply->message.values(), (Value::Dictionary{{"ReplyError", kReplyTooLarge}}));
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

TEST_F(ServerTest, HoldsUsersToTheirLimits) {
  start(echo, {.connectionsOfRoot = 3, .connectionsOfUser = 3, .bufferedBytesOfUser = 300'000});
  RawClient first = connect();
  RawClient second = connect();
  RawClient third = connect();
  EXPECT_TRUE(isServed(first) && isServed(second) && isServed(third));
  EXPECT_TRUE(connect().isEnded());
  third.close();
  EXPECT_TRUE(eventually([&] {
    RawClient another = connect();
    return another.send(requestFrame(1, 1)) != 0 && another.receive().has_value();
  }));

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

TEST_F(ServerTest, TakesOverAListeningSocketOnly) {
  EXPECT_EQ(Server::create(socketPath(), FileDescriptor(::socket(AF_UNIX, SOCK_STREAM, 0)), tasks_,
                           log_, acceptQueue_, echo)
                .error()
                .value,
            EINVAL);
  start(echo, {}, std::move(listenAt(socketPath(), SOCK_STREAM, 0600).value()));
  RawClient client = connect();
  EXPECT_TRUE(isServed(client));
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

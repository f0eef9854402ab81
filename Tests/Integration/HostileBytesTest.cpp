// Clients that send what no client should: raw bytes to the daemon's socket. A connection that
// breaks the protocol is closed, with one line in the log; a strange identifier is data and never
// a path. Meanwhile, and afterwards, others are served at once.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <filesystem>
#include <map>

#include "Platform/ipc/Codec.h"
#include "Platform/ipc/SocketPath.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/Watchdog.h"

namespace fs = std::filesystem;
using platform::FileDescriptor;
using platform::ipc::Message;
using Bytes = std::vector<uint8_t>;
using namespace std::string_literals;

namespace {

constexpr uid_t kMobile = 501;
constexpr uint64_t kPersonaList = 32;
constexpr uint64_t kNotFound = 21;
constexpr uint64_t kRefused = 55;
// What a lookup may take while others misbehave; it takes well under a millisecond.
constexpr std::chrono::milliseconds kAtOnce{kSanitizedStride > 1 ? 5000 : 1000};

Bytes frame(const Message& message, uint32_t sequence = 1) {
  return *platform::ipc::encodeFrame(message, sequence, /*flags=*/0);
}

// A body under a header that is in order but for the flags, or for the length that it claims.
Bytes framed(const std::string& body, uint32_t flags = 0, std::optional<uint32_t> length = {}) {
  const auto header = platform::ipc::encodeHeader(
      {.bodyLength = length.value_or(body.size()), .sequence = 1, .flags = flags});
  Bytes bytes(header.begin(), header.end());
  std::ranges::copy(body, std::back_inserter(bytes));
  return bytes;
}

std::string repeated(const std::string& text, size_t times) {
  return fmt::format("{}", fmt::join(std::vector<std::string>(times, text), ""));
}

Message request(const std::string& identifier, bool create) {
  return Message({{"Command", 0},
                  {"Identifier", identifier},
                  {"ContainerClass", 2},
                  {"CreateIfNecessary", create}});
}

class HostileBytes : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace();
    device_->start();
    client_.emplace(device_->connect(privilegedCaller()));
    ASSERT_TRUE(client_->createOrLookup("com.example.app", 2, {.createIfNecessary = true}));
    watchdog_.emplace(*device_);
  }

  FileDescriptor connect() const {
    auto socket =
        platform::ipc::connectTo(device_->path("/run/tessary/com.veltra.tessaryd"), SOCK_STREAM);
    EXPECT_TRUE(socket.has_value());
    return socket ? std::move(*socket) : FileDescriptor();
  }

  static void send(const FileDescriptor& socket, const Bytes& bytes) {
    // The daemon may have closed it by now.
    for (size_t sent = 0; sent < bytes.size();) {
      const ssize_t count =
          ::send(socket.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
      if (count <= 0) return;
      sent += static_cast<size_t>(count);
    }
  }

  // The next `count` bytes, fewer when the connection ends before.
  static Bytes receive(const FileDescriptor& socket, size_t count) {
    Bytes bytes(count);
    const ssize_t received = ::recv(socket.get(), bytes.data(), count, MSG_WAITALL);
    bytes.resize(static_cast<size_t>(std::max<ssize_t>(received, 0)));
    return bytes;
  }

  // The sequence number of the next reply; none when the connection has ended.
  static std::optional<uint32_t> receiveReply(const FileDescriptor& socket) {
    const Bytes head = receive(socket, platform::ipc::kFrameHeaderSize);
    if (head.size() < platform::ipc::kFrameHeaderSize) return std::nullopt;
    const auto decoded = platform::ipc::decodeHeader(
        std::span<const uint8_t, platform::ipc::kFrameHeaderSize>(head.data(), head.size()));
    if (!decoded || !platform::ipc::decodeMessage(receive(socket, decoded->bodyLength))) {
      return std::nullopt;
    }
    return decoded->sequence;
  }

  // Another client is served at once.
  void expectService() {
    const auto begin = std::chrono::steady_clock::now();
    const auto found = client_->createOrLookup("com.example.app", 2);
    EXPECT_TRUE(found.has_value()) << device_->systemLog().substr(0, 2000);
    EXPECT_LT(std::chrono::steady_clock::now() - begin, kAtOnce);
  }

  size_t endings() const {
    const std::string log = device_->systemLog();
    size_t count = 0;
    for (size_t at = 0; (at = log.find(" ended: ", at)) != std::string::npos; ++at) ++count;
    return count;
  }

  std::optional<Device> device_;
  std::optional<tessary::Client> client_;
  std::optional<Watchdog> watchdog_;  // also ends what would receive for ever
};

TEST_F(HostileBytes, EndTheirConnection) {
  const struct {
    const char* what;
    Bytes bytes;
    bool isCutShort = false;  // the connection is half closed after it
  } kCases[] = {
      {"magic", Bytes(100, 'x')},
      {"length 2^32-1", framed("", 0, UINT32_MAX)},
      {"length 0", framed("")},
      {"highest flag", framed("\xa0", uint32_t{1} << 31U)},
      {"no map", framed("\x80")},
      {"two values", framed("\xa0\xa0")},
      {"2^64-1 pairs", framed("\xbb"s + std::string(8, '\xff'))},
      {"2^63 elements", framed("\xa1\x61x\x9b\x80"s + std::string(7, '\0'))},
      {"4 GiB of text", framed("\xa1\x61x\x7a\xff\xff\xff\xff")},
      {"duplicate key, deep", framed("\xa1\x61x\xa2\x61y\x01\x61y\x01")},
      {"a million indefinite levels", framed("\xa1\x61x" + repeated("\x9f", 1'000'000))},
      {"16 MiB of empty arrays",
       framed("\xa1\x61x\x9a\x00\xff\xff\xf0"s + repeated("\x80", 0xfffff0))},
      {"half a header", Bytes{'T', 'S', 'Y'}, /*isCutShort=*/true},
      {"half a body", framed("", 0, platform::ipc::kMaximumBodySize), /*isCutShort=*/true},
  };
  const Bytes smuggled = frame(request("com.example.smuggled", /*create=*/true));
  for (const auto& [what, bytes, isCutShort] : kCases) {
    SCOPED_TRACE(what);
    const size_t before = endings();
    const FileDescriptor socket = connect();
    send(socket, bytes);
    if (isCutShort) expectService();
    if (isCutShort) ::shutdown(socket.get(), SHUT_WR);
    if (!isCutShort) send(socket, smuggled);
    EXPECT_TRUE(receive(socket, 1).empty()) << "something was answered";
    EXPECT_EQ(endings(), before + 1);
    expectService();
  }
  // A request that cannot be answered ends its connection too, and is not handled.
  const FileDescriptor socket = connect();
  send(socket, frame(request("com.example.smuggled", /*create=*/true), /*sequence=*/0));
  send(socket, smuggled);
  EXPECT_TRUE(receive(socket, 1).empty());
  EXPECT_NE(device_->daemonLog().find("Dictionary does not have reply context"), std::string::npos);
  const auto found = client_->createOrLookup("com.example.smuggled", 2);
  EXPECT_EQ(found ? 1 : found.error().code, kNotFound);
}

TEST_F(HostileBytes, WithoutAReaderOfTheRepliesDelayNobody) {
  constexpr int kClients = 80;  // more than there are workers
  constexpr uint32_t kRequests = 1000;
  Bytes requests;
  for (uint32_t sequence = 1; sequence <= kRequests; ++sequence) {
    const Bytes one = frame(request("com.example.app", /*create=*/false), sequence);
    requests.insert(requests.end(), one.begin(), one.end());
  }
  std::vector<FileDescriptor> sockets;
  for (int i = 0; i < kClients; ++i) {
    sockets.push_back(connect());
    // As much as it takes without waiting.
    (void)::send(sockets.back().get(), requests.data(), requests.size(),
                 MSG_DONTWAIT | MSG_NOSIGNAL);
    expectService();
  }
  const FileDescriptor late = connect();
  const std::jthread sender([&] { send(late, requests); });
  for (uint32_t sequence = 1; sequence <= kRequests; ++sequence) {
    ASSERT_EQ(receiveReply(late), sequence) << "once it reads, it has all its replies in order";
  }
}

TEST_F(HostileBytes, OfAStormAreRefusedToItsUserAlone) {
  constexpr int kConnections = 300;
  constexpr int kLimit = 256;
  const auto connectAsMobile = [&] {
    // Of this thread alone; the library's own function changes all threads.
    ::syscall(SYS_setresuid, -1, kMobile, -1);
    FileDescriptor socket = connect();
    ::syscall(SYS_setresuid, -1, 0, -1);
    return socket;
  };
  const auto isServed = [](const FileDescriptor& socket) {
    send(socket, frame(Message({{"Command", kPersonaList}})));
    return receiveReply(socket).has_value();
  };
  std::vector<FileDescriptor> storm;
  for (int i = 0; i < kConnections; ++i) storm.push_back(connectAsMobile());
  expectService();
  EXPECT_EQ(std::ranges::count_if(storm, isServed), kLimit);
  EXPECT_TRUE(isServed(connect())) << "root's, beside them";
  storm.clear();
  EXPECT_TRUE(becomes([&] { return isServed(connectAsMobile()); }));
}

TEST_F(HostileBytes, InIdentifiersAreNoPaths) {
  const std::string names[] = {
      "..",
      "/etc/passwd",
      "../../../../../../../../tmp/x",
      "",
      "%s%n",
      "x\nFORGED line",
      "\x1b[2J\x07\x7f",
      "x\u2028y\u202ez\u202c",
      std::string(65'536, 'x'),
      repeated("../", 30'000),
      ".com.veltra.tessary.metadata.plist",
      "00000000-0000-0000-0000-000000000000",
  };
  const std::pair<uint64_t, const char*> kClasses[] = {
      {1, "/private/var/containers/Bundle/Application"},
      {2, "/private/var/mobile/Containers/Data/Application"},
      {7, "/private/var/mobile/Containers/Shared/AppGroup"},
      {12, "/private/var/containers/Data/System"},
  };
  std::map<std::pair<uint64_t, std::string>, std::string> made;
  tessary::Client stranger = device_->connect(Caller());
  for (const auto& [containerClass, directory] : kClasses) {
    for (const std::string& name : names) {
      SCOPED_TRACE(name.substr(0, 100));
      const auto refused = stranger.createOrLookup(name, containerClass);
      EXPECT_EQ(refused ? 1 : refused.error().code, kRefused);
      const auto container =
          client_->createOrLookup(name, containerClass, {.createIfNecessary = true});
      if (!container) {
        EXPECT_EQ(container.error().kind, tessary::Error::Kind::daemon) << container.error().text;
        continue;
      }
      EXPECT_EQ(container->identifier, name);
      const fs::path path = container->path;
      EXPECT_EQ(path.parent_path(), device_->path(directory));
      EXPECT_TRUE(platform::UUID::parse(path.filename().string())) << path;
      EXPECT_TRUE(made.emplace(std::pair(containerClass, name), path).second);
    }
  }
  EXPECT_GT(made.size(), 30U) << "hardly any is accepted";

  // Nothing else has come anywhere.
  size_t onDisk = 0;
  for (const auto& [containerClass, directory] : kClasses) {
    onDisk += itemsIn(*device_, directory).size();
  }
  EXPECT_EQ(onDisk, made.size() + 1);
  EXPECT_TRUE(fs::is_empty(device_->path("/tmp")));

  // Each line of a log is a line that the daemon wrote.
  for (const std::string& log : {device_->systemLog(), device_->daemonLog()}) {
    EXPECT_EQ(log.find("\nFORGED"), std::string::npos);
    EXPECT_EQ(log.find_first_of("\x1b\x07\x7f\r"), std::string::npos);
  }
  // And each identifier is the same after a start.
  watchdog_.reset();
  ASSERT_EQ(device_->stop(), 0);
  device_->start();
  tessary::Client client = device_->connect(privilegedCaller());
  for (const auto& [what, path] : made) {
    const auto found = client.createOrLookup(what.second, what.first);
    ASSERT_TRUE(found.has_value()) << what.second.substr(0, 100);
    EXPECT_EQ(found->path, path);
  }
}

}  // namespace

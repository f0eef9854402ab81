// Clients that send what no client should: raw bytes to the daemon's socket. A connection that
// breaks the protocol is closed, with one line in the log; a strange identifier is data and never
// a path. Meanwhile, and afterwards, others are served at once.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <set>
#include <thread>

#include "Platform/ipc/Codec.h"
#include "Platform/ipc/SocketPath.h"
#include "Platform/values/UUID.h"
#include "Tests/Integration/Watchdog.h"

namespace fs = std::filesystem;
using platform::FileDescriptor;
using platform::ipc::Message;
using Bytes = std::vector<uint8_t>;
using namespace std::chrono_literals;
using namespace std::string_literals;

namespace {

constexpr uid_t kMobile = 501;
constexpr uint64_t kPersonaList = 32;
constexpr uint64_t kNotFound = 21;
constexpr uint64_t kRefused = 55;
constexpr char kSmuggled[] = "com.example.smuggled";
// What a lookup may take while others misbehave; it takes well under a millisecond.
constexpr std::chrono::milliseconds kAtOnce{kSanitizedStride > 1 ? 5000 : 1000};
constexpr int kPatienceInMilliseconds = 20'000;

Bytes frame(const Message& message, uint32_t sequence = 1) {
  return *platform::ipc::encodeFrame(message, sequence, /*flags=*/0);
}

// A body under a header that is in order.
Bytes framed(const std::string& body, uint32_t flags = 0) {
  const auto header = platform::ipc::encodeHeader(
      {.bodyLength = static_cast<uint32_t>(body.size()), .sequence = 1, .flags = flags});
  Bytes bytes(header.size() + body.size());
  std::copy(body.begin(), body.end(), std::copy(header.begin(), header.end(), bytes.begin()));
  return bytes;
}

// A header alone, that promises a body.
Bytes header(uint32_t length, const char* magic = "TSY1") {
  auto bytes = platform::ipc::encodeHeader({.bodyLength = 0, .sequence = 1, .flags = 0});
  std::copy_n(magic, 4, bytes.begin());
  for (int i = 0; i < 4; ++i)
    bytes.at(4U + static_cast<size_t>(i)) = static_cast<uint8_t>(length >> (8 * i));
  return {bytes.begin(), bytes.end()};
}

std::string repeated(const std::string& text, size_t times) {
  std::string result;
  for (size_t i = 0; i < times; ++i) result += text;
  return result;
}

Message lookUp(const std::string& identifier) {
  return Message({{"Command", 0}, {"Identifier", identifier}, {"ContainerClass", 2}});
}

class HostileBytes : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "processes of several users are needed";
    device_.emplace();
    device_->start();
    client_.emplace(device_->connect(privilegedCaller()));
    ASSERT_TRUE(client_->createOrLookup("com.example.app", 2, {.createIfNecessary = true}));
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

  // The next `count` bytes, fewer when the connection ends before; none when nothing comes in time.
  static std::optional<Bytes> receive(const FileDescriptor& socket, size_t count) {
    Bytes bytes;
    while (bytes.size() < count) {
      pollfd waiting{socket.get(), POLLIN, 0};
      if (::poll(&waiting, 1, kPatienceInMilliseconds) != 1) return std::nullopt;
      std::array<uint8_t, 4096> buffer{};
      const ssize_t received =
          ::recv(socket.get(), buffer.data(), std::min(buffer.size(), count - bytes.size()), 0);
      if (received <= 0) break;
      bytes.insert(bytes.end(), buffer.begin(), buffer.begin() + received);
    }
    return bytes;
  }

  // The sequence number of the next reply; none when the connection has ended.
  static std::optional<uint32_t> receiveReply(const FileDescriptor& socket) {
    const auto head = receive(socket, platform::ipc::kFrameHeaderSize);
    if (!head || head->size() < platform::ipc::kFrameHeaderSize) return std::nullopt;
    const auto decoded = platform::ipc::decodeHeader(
        std::span<const uint8_t, platform::ipc::kFrameHeaderSize>(head->data(), head->size()));
    if (!decoded) return std::nullopt;
    const auto body = receive(socket, decoded->bodyLength);
    if (!body || !platform::ipc::decodeMessage(*body)) return std::nullopt;
    return decoded->sequence;
  }

  // Another client is served at once.
  void expectService() {
    const auto begin = std::chrono::steady_clock::now();
    const auto found = client_->createOrLookup("com.example.app", 2);
    EXPECT_TRUE(found.has_value()) << device_->systemLog().substr(0, 2000);
    EXPECT_LT(std::chrono::steady_clock::now() - begin, kAtOnce);
  }

  size_t lines(const std::string& text) const {
    const std::string log = device_->systemLog();
    size_t count = 0;
    for (size_t at = log.find(text); at != std::string::npos; at = log.find(text, at + 1)) ++count;
    return count;
  }

  std::optional<Device> device_;
  std::optional<tessary::Client> client_;
};

TEST_F(HostileBytes, EndTheirConnection) {
  const std::string command =
      "\x67"
      "Command";
  const struct {
    const char* what;
    Bytes bytes;
    bool isCutShort = false;  // the connection is half closed after it
  } kCases[] = {
      {"magic", header(0, "TSY2")},
      {"text", Bytes(100, 'x')},
      {"length 2^32-1", header(UINT32_MAX)},
      {"length over the limit", header(platform::ipc::kMaximumBodySize + 1)},
      {"length 0", header(0)},
      {"flags of a reply", framed("\xa0", 1)},
      {"unknown flag", framed("\xa0", 2)},
      {"highest flag", framed("\xa0", uint32_t{1} << 31U)},
      {"no map", framed("\x80")},
      {"two values", framed("\xa0\xa0")},
      {"cut short", framed("\xa1" + command)},
      {"break", framed("\xff")},
      {"indefinite length without an end", framed("\xbf" + command + "\x18\x20")},
      {"odd indefinite map", framed("\xbf" + command + "\xff")},
      {"2^64-1 pairs", framed("\xbb"s + std::string(8, '\xff'))},
      {"2^63 elements", framed("\xa1\x61x\x9b\x80"s + std::string(7, '\0'))},
      {"4 GiB of text", framed("\xa1\x61x\x7a\xff\xff\xff\xff")},
      {"duplicate key", framed("\xa2" + command + "\x18\x20" + command + "\x18\x20")},
      {"duplicate key, deep", framed("\xa1\x61x\xa2\x61y\x01\x61y\x01")},
      {"number as key", framed("\xa1\x01\x01")},
      {"surrogate", framed("\xa1\x61x\x63\xed\xa0\x80")},
      {"overlong", framed("\xa1\x61x\x62\xc0\x80")},
      {"bad UTF-8 in a key", framed("\xa1\x61\xff\x01")},
      {"NUL", framed("\xa1\x61x\x63"
                     "a\0b"s)},
      {"unknown tag", framed("\xa1\x61x\xc2\x41\x01")},
      {"short UUID", framed("\xa1\x61x\xd8\x25\x41\x01")},
      {"65 levels", framed("\xa1\x61x" + repeated("\x81", 64) + "\x01")},
      {"a million levels", framed("\xa1\x61x" + repeated("\x81", 1'000'000) + "\x01")},
      {"a million indefinite levels", framed("\xa1\x61x" + repeated("\x9f", 1'000'000))},
      {"16 MiB of empty arrays",
       framed("\xa1\x61x\x9a\x00\xff\xff\xf0"s + repeated("\x80", 0xfffff0))},
      {"half a header", Bytes{'T', 'S', 'Y'}, /*isCutShort=*/true},
      {"half a body", header(16 * 1024 * 1024), /*isCutShort=*/true},
  };
  const Watchdog watchdog(*device_);
  Message create = lookUp(kSmuggled);
  create.set("CreateIfNecessary", true);
  for (const auto& [what, bytes, isCutShort] : kCases) {
    SCOPED_TRACE(what);
    const size_t before = lines(" ended: ");
    const FileDescriptor socket = connect();
    send(socket, bytes);
    if (isCutShort) {
      ::shutdown(socket.get(), SHUT_WR);
    } else {
      send(socket, frame(create));
    }
    const auto rest = receive(socket, 1);
    ASSERT_TRUE(rest.has_value()) << "the connection is still open";
    EXPECT_TRUE(rest->empty()) << "something was answered";
    EXPECT_EQ(lines(" ended: "), before + 1);
    expectService();
  }
  const auto smuggled = client_->createOrLookup(kSmuggled, 2);
  EXPECT_EQ(smuggled ? 1 : smuggled.error().code, kNotFound) << "what follows was handled";
}

TEST_F(HostileBytes, OfTheLargestFrameAreRead) {
  const Watchdog watchdog(*device_);
  Message message({{"Command", kPersonaList}, {"x", ""}});
  const size_t rest = frame(message).size() - platform::ipc::kFrameHeaderSize + 4;
  message.set("x", std::string(platform::ipc::kMaximumBodySize - rest, 'x'));
  const Bytes largest = frame(message);
  ASSERT_EQ(largest.size(), platform::ipc::kMaximumBodySize + platform::ipc::kFrameHeaderSize);
  const FileDescriptor socket = connect();
  for (int i = 0; i < 2; ++i) {
    send(socket, largest);
    EXPECT_TRUE(receiveReply(socket));
    expectService();
  }
}

TEST_F(HostileBytes, OneByOneDelayNobody) {
  const Watchdog watchdog(*device_);
  const FileDescriptor socket = connect();
  for (const uint8_t byte : frame(Message({{"Command", kPersonaList}}))) {
    send(socket, {byte});
    std::this_thread::sleep_for(50ms);
    expectService();
  }
  EXPECT_TRUE(receiveReply(socket));
}

TEST_F(HostileBytes, WithoutAReaderOfTheRepliesDelayNobody) {
  constexpr int kClients = 80;  // more than there are workers
  constexpr uint32_t kRequests = 1000;
  const Watchdog watchdog(*device_);
  Bytes requests;
  for (uint32_t sequence = 1; sequence <= kRequests; ++sequence) {
    const Bytes one = frame(lookUp("com.example.app"), sequence);
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
  std::jthread sender([&] { send(late, requests); });
  for (uint32_t sequence = 1; sequence <= kRequests; ++sequence) {
    ASSERT_EQ(receiveReply(late), sequence) << "once it reads, it has all its replies in order";
  }
  expectService();
}

TEST_F(HostileBytes, OfAStormAreRefusedToItsUserAlone) {
  constexpr int kConnections = 300;
  constexpr int kLimit = 256;
  const Watchdog watchdog(*device_);
  std::vector<FileDescriptor> storm;
  // Of this thread alone; the library's own function changes all threads.
  ASSERT_EQ(::syscall(SYS_setresuid, -1, kMobile, -1), 0);
  for (int i = 0; i < kConnections; ++i) storm.push_back(connect());
  ASSERT_EQ(::syscall(SYS_setresuid, -1, 0, -1), 0);
  expectService();
  int served = 0;
  for (const FileDescriptor& socket : storm) {
    send(socket, frame(Message({{"Command", kPersonaList}})));
    served += receiveReply(socket) ? 1 : 0;
  }
  EXPECT_EQ(served, kLimit);
  EXPECT_TRUE(tessary::Client::connect(device_->root())->personaList()) << "root's, beside them";

  storm.clear();
  const auto isServed = [&] {
    ::syscall(SYS_setresuid, -1, kMobile, -1);
    const FileDescriptor socket = connect();
    ::syscall(SYS_setresuid, -1, 0, -1);
    send(socket, frame(Message({{"Command", kPersonaList}})));
    return receiveReply(socket).has_value();
  };
  while (!isServed()) std::this_thread::sleep_for(1ms);  // the watchdog ends it
}

// --- Identifiers --------------------------------------------------------------------------------

TEST_F(HostileBytes, InIdentifiersAreNoPaths) {
  const std::string names[] = {
      "/",
      "..",
      ".",
      "../../x",
      "/etc/passwd",
      "a/b",
      "../../../../../../../../tmp/x",
      "",
      " ",
      "-rf",
      "%s%n",
      "x\nFORGED line",
      "x\r\nFORGED line",
      "\x1b[2J\x07\x7f",
      "x\tset\t501\t501\t1\tcom.example.app\t/etc",
      "x\u2028y\u202e",
      repeated("\u00e9", 20'000),
      repeated("\U0001f980", 10'000),
      std::string(65'536, 'x'),
      repeated("../", 30'000),
      ".com.veltra.tessary.metadata.plist",
      "00000000-0000-0000-0000-000000000000",
  };
  const struct {
    uint64_t containerClass;
    const char* directory;
  } kClasses[] = {{1, "/private/var/containers/Bundle/Application"},
                  {2, "/private/var/mobile/Containers/Data/Application"},
                  {7, "/private/var/mobile/Containers/Shared/AppGroup"},
                  {12, "/private/var/containers/Data/System"},
                  {13, "/private/var/containers/Shared/SystemGroup"}};
  const Watchdog watchdog(*device_);
  std::map<std::pair<uint64_t, std::string>, std::string> made;
  for (const auto& [containerClass, directory] : kClasses) {
    for (const std::string& name : names) {
      SCOPED_TRACE(name.substr(0, 100));
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
  EXPECT_GT(made.size(), 50U) << "hardly any is accepted";
  tessary::Client stranger = device_->connect(Caller());
  for (const std::string& name : names) {
    const auto refused = stranger.createOrLookup(name, 2);
    EXPECT_EQ(refused ? 1 : refused.error().code, kRefused) << name.substr(0, 100);
  }
  expectService();

  // Nothing else has come anywhere.
  size_t onDisk = 0;
  for (const auto& [containerClass, directory] : kClasses) {
    for (const auto& item : fs::directory_iterator(device_->path(directory))) {
      ++onDisk;
      EXPECT_TRUE(platform::UUID::parse(item.path().filename().string())) << item.path();
    }
  }
  EXPECT_EQ(onDisk, made.size() + 1);
  EXPECT_TRUE(fs::is_empty(device_->path("/tmp")));

  // Each line of a log is a line that the daemon wrote.
  for (const std::string& log : {device_->systemLog(), device_->daemonLog()}) {
    EXPECT_EQ(log.find("\nFORGED"), std::string::npos);
    EXPECT_EQ(log.find_first_of("\x1b\x07\x7f\r"), std::string::npos);
  }
  std::ifstream mappings(device_->path("/run/tessary/sandbox/mappings"));
  for (std::string line; std::getline(mappings, line);) {
    EXPECT_TRUE(line.starts_with("set\t")) << line.substr(0, 200);
    EXPECT_EQ(std::ranges::count(line, '\t'), 5) << line.substr(0, 200);
    EXPECT_TRUE(fs::is_directory(line.substr(line.rfind('\t') + 1))) << line.substr(0, 200);
  }

  // And each identifier is the same after a start.
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

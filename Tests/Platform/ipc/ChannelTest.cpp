#include "Platform/ipc/Channel.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <thread>

#include "Platform/ipc/SocketPath.h"
#include "Tests/Platform/ipc/HexBytes.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform::ipc {
namespace {

// Makes a call to a service that sends `answer`, whatever it was asked, and nothing more.
std::expected<Message, ChannelError> callAnswered(const TestRoot& root,
                                                  const std::vector<uint8_t>& answer) {
  const auto listener = listenAt(root.path("service"), SOCK_STREAM, 0600);
  EXPECT_TRUE(listener);
  auto channel = Channel::connect(root.path("service"));
  EXPECT_TRUE(channel);
  const FileDescriptor peer(::accept4(listener->get(), nullptr, nullptr, SOCK_CLOEXEC));
  std::thread service([&] {
    std::array<uint8_t, 256> request{};
    EXPECT_GT(::recv(peer.get(), request.data(), request.size(), 0), 0);
    EXPECT_EQ(::send(peer.get(), answer.data(), answer.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(answer.size()));
    ::shutdown(peer.get(), SHUT_WR);
  });
  auto reply = channel->call(Message());
  service.join();
  return reply;
}

TEST(ChannelTest, TakesOnlyTheReplyToItsRequest) {
  const struct {
    const char* answer;
    const char* error;  // null: it is the reply
  } cases[] = {
      {"54535931 01000000 01000000 01000000 a0", nullptr},
      {"54535931 01000000 02000000 01000000 a0", "another request"},
      {"54535931 01000000 01000000 00000000 a0", "not a reply"},
      {"54535931 01000000 01000000 01000000 a0a0", "after the reply"},
      {"54535931 02000000 01000000 01000000 a0", "closed the connection"},
      {"", "closed the connection"},
      {"54535932 01000000 01000000 01000000 a0", "malformed"},
      {"54535931 01000000 01000000 01000000 80", "malformed"},
  };
  for (const auto& [answer, error] : cases) {
    TestRoot root;
    const auto reply = callAnswered(root, hexBytes(answer));
    ASSERT_EQ(reply.has_value(), error == nullptr) << answer;
    if (error == nullptr) continue;
    EXPECT_THAT(reply.error().reason, testing::HasSubstr(error));
  }
}

TEST(SocketPathTest, BindsAndConnectsUnderPathsOfAnyLength) {
  const TestRoot root;
  std::string directory = root.path("");
  for (const size_t length : {10UL, 100UL, 1000UL}) {
    while (directory.size() < length) directory += std::string(90, 'd') + "/";
    std::filesystem::create_directories(directory);
    const std::string path = directory + "service";
    const auto listener = listenAt(path, SOCK_SEQPACKET, 0666);
    ASSERT_TRUE(listener) << length;
    const auto client = connectTo(path, SOCK_SEQPACKET);
    ASSERT_TRUE(client) << length;
    EXPECT_GE(FileDescriptor(::accept(listener->get(), nullptr, nullptr)).get(), 0);
  }
}

TEST(SocketPathTest, ReplacesOnlyASocketThatNobodyListensOn) {
  const TestRoot root;
  const std::string path = root.path("service");
  auto listener = listenAt(path, SOCK_STREAM, 0666);
  EXPECT_EQ(listenAt(path, SOCK_STREAM, 0666).error().value, EADDRINUSE);
  listener->reset();
  EXPECT_EQ(connectTo(path, SOCK_STREAM).error().value, ECONNREFUSED);
  EXPECT_TRUE(listenAt(path, SOCK_STREAM, 0666));

  root.write("file", "content");
  std::filesystem::create_symlink(path, root.path("link"));
  for (const char* name : {"file", "link"}) {
    EXPECT_EQ(listenAt(root.path(name), SOCK_STREAM, 0666).error().value, EADDRINUSE) << name;
  }
  EXPECT_EQ(root.read("file"), "content");
}

}  // namespace
}  // namespace platform::ipc

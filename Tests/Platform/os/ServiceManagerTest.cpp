// What the process tells others of itself: the service manager, keep-alive, the system log.
#include "Platform/os/ServiceManager.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstdlib>
#include <regex>
#include <thread>

#include "Platform/os/KeepAlive.h"
#include "Platform/os/SystemLog.h"

namespace platform {
namespace {

TEST(ServiceManager, TellsTheManager) {
  const FileDescriptor manager(::socket(AF_UNIX, SOCK_DGRAM, 0));
  const std::string name = "tessary-test-" + std::to_string(::getpid());
  sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
  name.copy(address.sun_path + 1, name.size());  // in the abstract name space
  const auto length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + name.size());
  ASSERT_EQ(::bind(manager.get(), reinterpret_cast<sockaddr*>(&address), length), 0);
  ::setenv("NOTIFY_SOCKET", ("@" + name).c_str(), 1);
  const auto received = [&] {
    char text[128] = {};
    EXPECT_GT(::recv(manager.get(), text, sizeof text - 1, MSG_DONTWAIT), 0);
    return std::string(text);
  };
  const ServiceManager service;
  service.notifyReady();
  EXPECT_EQ(received(), "READY=1");
  service.extendTimeout(std::chrono::seconds(60));
  EXPECT_EQ(received(), "EXTEND_TIMEOUT_USEC=60000000");
  EXPECT_EQ(service.watchdogInterval().count(), 0);
  ::setenv("WATCHDOG_USEC", "3000000", 1);
  EXPECT_EQ(service.watchdogInterval().count(), 1500000);
}

TEST(ServiceManager, HandsOverListeningSocketsByName) {
  const ServiceManager service;
  EXPECT_FALSE(service.takeSocket("first").valid());
  // The manager's sockets come as descriptors 3 and up.
  const int listening = ::socket(AF_UNIX, SOCK_STREAM, 0);
  const sockaddr_un unnamed{.sun_family = AF_UNIX, .sun_path = {}};
  ASSERT_EQ(::bind(listening, reinterpret_cast<const sockaddr*>(&unnamed), sizeof(sa_family_t)), 0);
  ASSERT_EQ(::listen(listening, 1), 0);
  const int plain = ::socket(AF_UNIX, SOCK_STREAM, 0);
  const int sources[] = {::fcntl(plain, F_DUPFD, 10), ::fcntl(listening, F_DUPFD, 10)};
  for (int i = 0; i < 2; ++i) ASSERT_EQ(::dup2(sources[i], 3 + i), 3 + i);
  ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
  ::setenv("LISTEN_FDS", "2", 1);
  ::setenv("LISTEN_FDNAMES", "first:second", 1);
  EXPECT_FALSE(service.takeSocket("first").valid()) << "does not listen";
  EXPECT_EQ(service.takeSocket("second").get(), 4);
  EXPECT_FALSE(service.takeSocket("third").valid());
}

TEST(KeepAlive, WaitsForTheLastTransaction) {
  KeepAlive keepAlive;
  EXPECT_TRUE(keepAlive.waitUntilIdle(std::chrono::milliseconds(0)));
  auto first = std::make_unique<KeepAlive::Transaction>(keepAlive);
  auto moved = std::make_unique<KeepAlive::Transaction>(std::move(*first));
  first.reset();
  EXPECT_EQ(keepAlive.openTransactions(), 1);
  EXPECT_FALSE(keepAlive.waitUntilIdle(std::chrono::milliseconds(20)));
  std::thread other([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    moved.reset();
  });
  EXPECT_TRUE(keepAlive.waitUntilIdle(std::chrono::minutes(1)));
  other.join();
}

TEST(SystemLog, WritesOneLineForOneMessage) {
  ::testing::internal::CaptureStderr();
  const SystemLog log(LogLevel::standard, /*journal=*/false);
  log.write(LogLevel::info, "cache", "[Class operation]", 0, "below the threshold");
  log.write(LogLevel::error, "cache", "[Class operation]", 73,
            std::string_view("a\nb\x1B[2J\0\xC2\x9B\xC3\xA4", 12));
  const std::string text = ::testing::internal::GetCapturedStderr();
  const std::regex expected(
      "\\d{4}-\\d\\d-\\d\\dT\\d\\d:\\d\\d:\\d\\d\\.\\d{6}Z error cache \\[Class operation\\]: "
      "a\\\\nb\\\\x1b\\[2J\\\\x00\xC2\\\\x9b\xC3\xA4 \\(code 73\\)\n");
  EXPECT_TRUE(std::regex_match(text, expected)) << text;
}

TEST(SystemLog, TakesItsThresholdFromTheEnvironment) {
  const auto enabledAt = [](const char* level) {
    ::setenv("TESSARY_LOG_LEVEL", level, 1);
    const SystemLog log;
    return std::pair(log.enabled(LogLevel::info), log.enabled(LogLevel::standard));
  };
  EXPECT_EQ(enabledAt("debug"), std::pair(true, true));
  EXPECT_EQ(enabledAt("default"), std::pair(false, true));
  EXPECT_EQ(enabledAt("error"), std::pair(false, false));
  EXPECT_EQ(enabledAt("loud"), std::pair(false, true));
}

}  // namespace
}  // namespace platform

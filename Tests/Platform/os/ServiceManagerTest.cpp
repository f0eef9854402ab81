// What the process tells others of itself: the service manager and the system log.
#include "Platform/os/ServiceManager.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstdlib>
#include <regex>
#include <system_error>

#include "Platform/os/SystemLog.h"

namespace platform {
namespace {

int unixSocket() {
  const int socket = ::socket(AF_UNIX, SOCK_STREAM, 0);
  if (socket < 0) throw std::system_error(errno, std::generic_category(), "socket");
  return socket;
}

TEST(ServiceManager, HandsOverListeningSocketsByName) {
  const ServiceManager service;
  EXPECT_FALSE(service.takeSocket("first").valid());
  // The manager's sockets come as descriptors 3 and up.
  const int listening = unixSocket();
  const sockaddr_un unnamed{.sun_family = AF_UNIX, .sun_path = {}};
  ASSERT_EQ(::bind(listening, reinterpret_cast<const sockaddr*>(&unnamed), sizeof(sa_family_t)), 0);
  ASSERT_EQ(::listen(listening, 1), 0);
  const int plain = unixSocket();
  const int sources[] = {::fcntl(plain, F_DUPFD, 10), ::fcntl(listening, F_DUPFD, 10)};
  for (int i = 0; i < 2; ++i) ASSERT_EQ(::dup2(sources[i], 3 + i), 3 + i);
  ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
  ::setenv("LISTEN_FDS", "2", 1);
  ::setenv("LISTEN_FDNAMES", "first:second", 1);
  EXPECT_FALSE(service.takeSocket("first").valid()) << "does not listen";
  EXPECT_EQ(service.takeSocket("second").get(), 4);
  EXPECT_FALSE(service.takeSocket("third").valid());
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

}  // namespace
}  // namespace platform

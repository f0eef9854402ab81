#include "Daemon/TSYError.h"

#include <gtest/gtest.h>
#include <pthread.h>

#include <fstream>
#include <thread>

#include "Daemon/TSYException.h"
#include "Daemon/TSYLog.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

using namespace std::string_literals;

std::string logPath() {
  return fmt::format("{}/daemon-log.{}", testing::TempDir(), ::getpid());
}

// The log's lines without what stands before the text.
std::vector<std::string> linesOfLog() {
  std::vector<std::string> lines;
  std::ifstream log(logPath());
  for (std::string line; std::getline(log, line);) lines.push_back(line.substr(line.find("]: ")));
  std::remove(logPath().c_str());
  return lines;
}

TSYError disk() {
  return TSYPosixErrorCreate(platform::Errno{EIO}, "the disk {}", "broke");
}

TEST(TSYError, carriesWhatItWasBuiltFrom) {
  const unsigned line = __LINE__ + 1;
  const TSYError error = TSYErrorCreate(TSYErrorNotFound, disk(), TSYLogIt::no, "{} of {}", 1, "x");
  EXPECT_TRUE(error.is(TSYErrorNotFound));
  EXPECT_FALSE(error.isPosix(TSYErrorNotFound)) << "the domain counts";
  EXPECT_EQ(error.localizedDescription(), "1 of x");
  EXPECT_EQ(error.functionName(), "[TSYError_carriesWhatItWasBuiltFrom_Test TestBody]");
  EXPECT_EQ(error.sourceFileLine(), line);
  EXPECT_EQ(error.description(), R"(TSYErrorDomain:21 "1 of x" (POSIX:5 "the disk broke"))");
  ASSERT_TRUE(error.underlying());
  EXPECT_TRUE(error.underlying()->isPosix(EIO));
  EXPECT_EQ(error.underlying()->functionName(), "disk");
  EXPECT_FALSE(TSYErrorCreate(77, std::nullopt, TSYLogIt::no).localizedDescription());
}

TEST(TSYError, isOneLineOfTheLogWhenAskedToBe) {
  ASSERT_TRUE(TSYLogOpen(logPath(), TSYLogLevelNotice, {.files = 1, .bytesPerFile = 1 << 20}));
  (void)TSYErrorCreate(6, std::nullopt, TSYLogIt::yes, "alone {}", 1);
  (void)TSYErrorCreate(6, disk(), TSYLogIt::yes, "together");
  (void)TSYErrorCreate(6, disk(), TSYLogIt::no, "silent");
  (void)TSYErrorCreate(6, disk(), TSYLogIt::yes);  // nothing to say
  const auto thrown =
      TSYCatchingExceptions([]() -> TSYResult<int> { throw std::runtime_error("the reason"); });
  expectFailure(thrown, 40, "runtime_error : the reason");
  TSYLogWrite(TSYLogLevelDebug, "above the threshold");
  // Whatever a client has put into it.
  TSYLogWrite(TSYLogLevelError, "{}", "a\nb\r\x1b[2J\x7f\t%n {} \u00e4\0"s);
  const auto lines = linesOfLog();
  ASSERT_EQ(lines.size(), 4U);
  EXPECT_TRUE(lines[0].ends_with(": alone 1")) << lines[0];
  EXPECT_TRUE(lines[1].ends_with(R"(: together (POSIX:5 "the disk broke"))")) << lines[1];
  EXPECT_TRUE(lines[2].ends_with("runtime_error : the reason")) << lines[2];
  EXPECT_EQ(lines[3], "]: a\\x0ab\\x0d\\x1b[2J\\x7f\\x09%n {} \u00e4\\x00");
}

TEST(TSYLogDeathTest, anUncaughtExceptionLeavesItsText) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  TSYInstallUncaughtExceptionHandler();
  const auto throwing = [] {
    std::thread([] {
      ::pthread_setname_np(::pthread_self(), "worker");
      throw std::runtime_error("the reason");
    }).join();
  };
  EXPECT_DEATH(throwing(), lastWords("INTERNAL ERROR: Uncaught Exception.*Exception: <worker> "
                                     "std::runtime_error: the reason.*Stack:"));
  const auto throwingNumber = [] { std::thread([] { throw 7; }).join(); };
  EXPECT_DEATH(throwingNumber(), lastWords("Exception: <.*> int: .*Stack:"));
}

}  // namespace

#include "Daemon/TSYError.h"

#include <gtest/gtest.h>
#include <pthread.h>

#include <fstream>
#include <thread>

#include "Daemon/TSYException.h"
#include "Daemon/TSYLog.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

constexpr TSYLogRotation kRotation{.files = 1, .bytesPerFile = 1 << 20};

std::string logPath() {
  return fmt::format("{}/daemon-log.{}", testing::TempDir(), ::getpid());
}

// The log's lines without what stands before the function name.
std::vector<std::string> linesOfLog() {
  std::vector<std::string> lines;
  std::ifstream log(logPath());
  for (std::string line; std::getline(log, line);) {
    const size_t level = line.find(" E ");
    lines.push_back(level == std::string::npos ? line : line.substr(level + 3));
  }
  std::remove(logPath().c_str());
  return lines;
}

TSYError disk() {
  return TSYPosixErrorCreate(platform::Errno{EIO}, "the disk {}", "broke");
}

TEST(TSYError, carriesWhatItWasBuiltFrom) {
  const unsigned line = __LINE__ + 1;
  const TSYError plain = TSYErrorCreate(TSYErrorNotFound, disk(), TSYLogIt::no, "{} of {}", 1, "x");
  EXPECT_EQ(plain.domain(), "TSYErrorDomain");
  EXPECT_EQ(plain.code(), 21U);
  EXPECT_TRUE(plain.is(TSYErrorNotFound));
  EXPECT_FALSE(plain.isPosix(TSYErrorNotFound)) << "the domain counts";
  EXPECT_EQ(plain.localizedDescription(), "1 of x");
  EXPECT_EQ(plain.functionName(), "[TSYError_carriesWhatItWasBuiltFrom_Test TestBody]");
  EXPECT_EQ(plain.sourceFileLine(), line);
  EXPECT_EQ(plain.description(), R"(TSYErrorDomain:21 "1 of x" (POSIX:5 "the disk broke"))");
  ASSERT_TRUE(plain.underlying());
  EXPECT_TRUE(plain.underlying()->isPosix(EIO));
  EXPECT_FALSE(plain.underlying()->is(TSYErrorTransientRemoveFailed)) << "code 5 of the other";
  EXPECT_EQ(plain.underlying()->functionName(), "disk");

  const TSYError bare = TSYErrorCreate(TSYErrorQueueEmpty, std::nullopt, TSYLogIt::no);
  EXPECT_FALSE(bare.localizedDescription());
  EXPECT_FALSE(bare.underlying());
  EXPECT_EQ(bare.functionName(), plain.functionName());
  EXPECT_EQ(TSYError::withoutDetail().code(), 1U);
  EXPECT_EQ(TSYError::withoutDetail().functionName(), plain.functionName());
}

TEST(TSYError, logsItsTextWithTheUnderlyingErrorWhenAskedTo) {
  ASSERT_TRUE(TSYLogOpen(logPath(), TSYLogLevelNotice, kRotation));
  const unsigned line = __LINE__ + 1;
  (void)TSYErrorCreate(6, std::nullopt, TSYLogIt::yes, "alone {}", 1);
  (void)TSYErrorCreate(6, disk(), TSYLogIt::yes, "together");
  (void)TSYErrorCreate(6, disk(), TSYLogIt::no, "silent");
  (void)TSYErrorCreate(6, disk(), TSYLogIt::yes);  // nothing to say
  const std::string function =
      "[TSYError_logsItsTextWithTheUnderlyingErrorWhenAskedTo_Test TestBody]";
  EXPECT_EQ(linesOfLog(),
            (std::vector<std::string>{fmt::format("{}: {}: alone 1", function, line),
                                      fmt::format(R"({}: {}: together (POSIX:5 "the disk broke"))",
                                                  function, line + 1)}));
}

TEST(TSYError, isNotLoggedBelowTheThreshold) {
  ASSERT_TRUE(TSYLogOpen(logPath(), 2, kRotation));
  const TSYError error = TSYErrorCreate(6, std::nullopt, TSYLogIt::yes, "{}", "text");
  EXPECT_EQ(error.localizedDescription(), "text");
  EXPECT_EQ(linesOfLog(), std::vector<std::string>());
}

TEST(TSYError, exceptionsBecomeCode40) {
  ASSERT_TRUE(TSYLogOpen(logPath(), TSYLogLevelNotice, kRotation));
  const auto result =
      TSYCatchingExceptions([]() -> TSYResult<int> { throw std::runtime_error("the reason"); });
  expectFailure(result, 40, "Got exception: ");
  expectFailure(result, 40, "runtime_error : the reason");
  EXPECT_EQ(linesOfLog().size(), 1U);
  EXPECT_EQ(TSYCatchingExceptions([]() -> TSYResult<int> { return 7; }).value_or(0), 7);
}

// What functions see of themselves.
using Where = std::source_location;
const Where* pointerFunction(Where& where, void (*)(int), Where here = Where::current()) {
  where = Where::current();
  return here.line() == 0 ? nullptr : &where;
}
struct Outer {
  struct Inner {
    Inner() : where(Where::current()) {}
    Where where;
  };
  Where& reference() { return where = Where::current(); }
  static std::pair<Where, unsigned long> pair() { return {Where::current(), 1}; }
  static Where lambda() {
    return [] { return Where::current(); }();
  }
  Where where;
};
template <typename Key, typename Value>
struct Table {
  template <typename T>
  std::pair<Key, Where> operation(T) {
    return {Key(), Where::current()};
  }
};

TEST(TSYError, functionNamesAreClassAndOperation) {
  Where where;
  const std::pair<std::string, std::string> cases[] = {
      {TSYFunctionName(*pointerFunction(where, nullptr)), "pointerFunction"},
      {TSYFunctionName(Outer::Inner().where), "[Inner Inner]"},
      {TSYFunctionName(Outer().reference()), "[Outer reference]"},
      {TSYFunctionName(Outer::pair().first), "[Outer pair]"},
      {TSYFunctionName(Outer::lambda()), "[Outer lambda]"},
      {TSYFunctionName(Table<std::string, unsigned long>().operation(1UL).second),
       "[Table operation]"}};
  for (const auto& [name, expected] : cases) EXPECT_EQ(name, expected);
}

TEST(TSYLog, whatIsAboveTheThresholdIsNotHandedOver) {
  EXPECT_FALSE(TSYLogOpen("/dev/null/none", TSYLogLevelNotice, kRotation));
  EXPECT_TRUE(TSYLogIsEnabled(TSYLogLevelDebug)) << "without a log there is no threshold";
  ASSERT_TRUE(TSYLogOpen(logPath(), TSYLogLevelNotice, kRotation));
  TSYLogWrite(TSYLogLevelDebug, "debug");
  TSYLogWrite(TSYLogLevelNotice, "notice");
  TSYLogWrite(TSYLogLevelError, "error");
  EXPECT_EQ(linesOfLog().size(), 2U);
}

TEST(TSYLog, aMessageIsOneLineWhateverAClientPutIntoIt) {
  ASSERT_TRUE(TSYLogOpen(logPath(), TSYLogLevelNotice, kRotation));
  std::string hostile = "a\nb\r\x1b[2J\x7f\t%n {} \u00e4";
  hostile += '\0';
  TSYLogWrite(TSYLogLevelError, "{}", hostile);
  EXPECT_EQ(linesOfLog(), std::vector<std::string>{
                              "[TSYLog_aMessageIsOneLineWhateverAClientPutIntoIt_Test TestBody]: "
                              "a\\x0ab\\x0d\\x1b[2J\\x7f\\x09%n {} \u00e4\\x00"});
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

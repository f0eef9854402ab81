#include "Platform/os/Tasks.h"

#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>

#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

TEST(AuditToken, IsEightLittleEndianNumbers) {
  const auto bytes = AuditToken::make(0x01020304, 5, 6, 0x0000'0008'0000'0007).bytes();
  EXPECT_EQ(std::vector<uint8_t>(bytes.begin(), bytes.end()),
            (std::vector<uint8_t>{4, 3, 2, 1, 5, 0, 0, 0, 4, 3, 2, 1, 5, 0, 0, 0,
                                  0, 0, 0, 0, 6, 0, 0, 0, 7, 0, 0, 0, 8, 0, 0, 0}));
}

TEST(ProcessStartTime, DoesNotTrustTheNameOfTheProgram) {
  const auto before = processStartTime(::getpid());
  ASSERT_TRUE(before);
  ASSERT_EQ(::prctl(PR_SET_NAME, "a) S 1 2 (b"), 0);
  EXPECT_EQ(processStartTime(::getpid()).value(), *before);
  EXPECT_EQ(processStartTime(0x7FFFFFFF).error().value, ESRCH);
}

TEST(Tasks, RefuseMalformedRecords) {
  TestRoot root;
  const Tasks tasks(root.files());
  ASSERT_TRUE(tasks.write(4242, 7, {}));
  // Not sandboxed would be more rights than "Sandboxed" in another type may have meant.
  root.writePropertyList("run/tessary/tasks/4242.7.plist",
                         Value(Value::Dictionary{{"Sandboxed", "yes"}}));
  EXPECT_EQ(tasks.record(4242, 7).error().value, EINVAL);
}

TEST(Tasks, LoseTheRecordsOfEndedProcesses) {
  TestRoot root;
  const Tasks tasks(root.files());
  const uint64_t ownStart = processStartTime(::getpid()).value();
  const pid_t child = ::fork();
  if (child == 0) ::pause();
  const uint64_t childStart = processStartTime(child).value();
  ASSERT_TRUE(tasks.write(::getpid(), ownStart, {}));
  ASSERT_TRUE(tasks.write(::getpid(), ownStart + 1, {}));
  ASSERT_TRUE(tasks.write(child, childStart, {}));
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);
  tasks.removeStale();
  const auto processes = tasks.processes();
  ASSERT_TRUE(processes);
  ASSERT_EQ(processes->size(), 1U);
  EXPECT_EQ(processes->front().startTime, ownStart);
}

}  // namespace
}  // namespace platform

#include "Platform/os/Tasks.h"

#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include "Tests/Platform/os/TestRoot.h"

namespace platform {
namespace {

constexpr pid_t kPid = 4242;
constexpr uint64_t kStart = 0x1'0000'0007;

TEST(AuditToken, IsEightLittleEndianNumbers) {
  const AuditToken token = AuditToken::make(0x01020304, 5, 6, 0x0000'0008'0000'0007);
  const auto bytes = token.bytes();
  const std::vector<uint8_t> head(bytes.begin(), bytes.begin() + 8);
  EXPECT_EQ(head, (std::vector<uint8_t>{4, 3, 2, 1, 5, 0, 0, 0}));
  const std::vector<uint8_t> tail(bytes.begin() + 16, bytes.end());
  EXPECT_EQ(tail, (std::vector<uint8_t>{0, 0, 0, 0, 6, 0, 0, 0, 7, 0, 0, 0, 8, 0, 0, 0}));
  EXPECT_EQ(token.startTime(), 0x0000'0008'0000'0007U);
}

TEST(ProcessStartTime, DoesNotTrustTheNameOfTheProgram) {
  const auto before = processStartTime(::getpid());
  ASSERT_TRUE(before);
  EXPECT_GT(*before, 0U);
  ASSERT_EQ(::prctl(PR_SET_NAME, "a) S 1 2 (b"), 0);
  EXPECT_EQ(processStartTime(::getpid()).value(), *before);
  EXPECT_EQ(processStartTime(0x7FFFFFFF).error().value, ESRCH);
}

TEST(Tasks, KeepWhatTheLauncherWrote) {
  TestRoot root;
  const Tasks tasks(root.files());
  EXPECT_EQ(tasks.record(kPid, kStart).error().value, ENOENT);
  const TaskRecord written{
      .signingIdentifier = "com.example.app",
      .entitlements = std::make_shared<const Value::Dictionary>(Value::Dictionary{{"key", true}}),
      .sandboxed = true,
      .personaUniqueString = "work",
      .kernelTask = true};
  ASSERT_TRUE(tasks.write(kPid, kStart, written));
  const auto record = tasks.record(kPid, kStart);
  ASSERT_TRUE(record);
  EXPECT_EQ(record->signingIdentifier, written.signingIdentifier);
  EXPECT_EQ(*record->entitlements, *written.entitlements);
  EXPECT_EQ(record->personaUniqueString, "work");
  EXPECT_TRUE(record->sandboxed && record->kernelTask);
  EXPECT_EQ(tasks.record(kPid, kStart + 1).error().value, ENOENT) << "a later process of the pid";
}

TEST(Tasks, DoNotBelieveWhatOthersCouldHaveWritten) {
  struct Case {
    const char* what;
    std::function<void(const TestRoot&, const std::string& record)> tamper;
  };
  const std::vector<Case> cases{
      {"group may write", [](auto&, auto& record) { ::chmod(record.c_str(), 0620); }},
      {"others may write", [](auto&, auto& record) { ::chmod(record.c_str(), 0602); }},
      {"directory open to the group",
       [](auto& root, auto&) { ::chmod(root.path("run/tessary/tasks").c_str(), 0770); }},
      {"link to a good record",
       [](auto& root, auto& record) {
         std::filesystem::rename(record, root.path("run/tessary/tasks/elsewhere"));
         std::filesystem::create_symlink("elsewhere", record);
       }},
      {"FIFO",
       [](auto&, auto& record) {
         std::filesystem::remove(record);
         ::mkfifo(record.c_str(), 0600);
       }},
      {"file of another user", [](auto&, auto& record) { ::chown(record.c_str(), 501, 501); }},
      {"directory of another user",
       [](auto& root, auto&) { ::chown(root.path("run/tessary/tasks").c_str(), 501, 501); }},
  };
  const size_t possible = ::geteuid() == 0 ? cases.size() : cases.size() - 2;
  for (size_t i = 0; i < possible; ++i) {
    TestRoot root;
    const Tasks tasks(root.files());
    ASSERT_TRUE(tasks.write(kPid, kStart, {}));
    cases[i].tamper(root, root.path("run/tessary/tasks/4242.4294967303.plist"));
    const auto record = tasks.record(kPid, kStart);
    ASSERT_FALSE(record) << cases[i].what;
    EXPECT_EQ(record.error().value, EPERM) << cases[i].what;
  }
}

TEST(Tasks, RefuseMalformedRecords) {
  TestRoot root;
  const Tasks tasks(root.files());
  const std::string path = "run/tessary/tasks/4242.4294967303.plist";
  ASSERT_TRUE(tasks.write(kPid, kStart, {}));
  root.write(path, "bplist00 and nothing more");
  EXPECT_EQ(tasks.record(kPid, kStart).error().value, EINVAL);
  // Not sandboxed would be more rights than "Sandboxed" in another type may have meant.
  root.writePropertyList(path, Value(Value::Dictionary{{"Sandboxed", "yes"}}));
  EXPECT_EQ(tasks.record(kPid, kStart).error().value, EINVAL);
  root.writePropertyList(path, Value(Value::Dictionary{{"Entitlements", "all"}}));
  const auto record = tasks.record(kPid, kStart);
  ASSERT_TRUE(record);
  EXPECT_EQ(record->entitlements, nullptr);
}

TEST(Tasks, LoseTheRecordsOfEndedProcesses) {
  TestRoot root;
  const Tasks tasks(root.files());
  const uint64_t ownStart = processStartTime(::getpid()).value();
  const pid_t child = ::fork();
  if (child == 0) ::pause();
  const uint64_t childStart = processStartTime(child).value();
  for (const auto& [pid, start] : std::vector<std::pair<pid_t, uint64_t>>{
           {::getpid(), ownStart}, {::getpid(), ownStart + 1}, {child, childStart}}) {
    ASSERT_TRUE(tasks.write(pid, start, {}));
  }
  root.write("run/tessary/tasks/unknown", "kept");
  ::kill(child, SIGKILL);
  ::waitpid(child, nullptr, 0);
  tasks.removeStale();
  const auto processes = tasks.processes();
  ASSERT_TRUE(processes);
  ASSERT_EQ(processes->size(), 1U);
  EXPECT_EQ(processes->front().startTime, ownStart);
  EXPECT_EQ(root.read("run/tessary/tasks/unknown"), "kept");
}

}  // namespace
}  // namespace platform

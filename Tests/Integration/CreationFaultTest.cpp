// Each call to the file system that a creation makes fails once. The answer is the code of the step
// that it belongs to, what was built is on its way out, and the next request succeeds.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <set>

#include "Platform/values/UUID.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Integration/SystemCalls.h"

namespace {

constexpr uint64_t kSuccess = 1;
constexpr char kTemporaryMetadata[] = "temp_metadata-";

struct Step {
  const char* name;
  uint64_t code;
};
constexpr Step kFinding{"finding", 43};
constexpr Step kStaging{"staging directory", 7};
constexpr Step kMetadata{"metadata", 34};
constexpr Step kList{"access-control list", 63};
constexpr Step kSubdirectories{"subdirectories", 6};
constexpr Step kMoving{"move into place", 8};
constexpr Step kEntering{"entering", kSuccess};

// Follows a creation through its steps by the paths that its calls name. A call without one belongs
// to what was named last.
class Progress {
 public:
  void follow(const FileCall& call) {
    if (isMoved_) step_ = &kEntering;
    if (!call.path.empty()) name(call);
    if (call.name == "renameat" && isUUID(call.path)) isMoved_ = true;
  }

  const Step& step() const { return *step_; }

  // Whether a daemon does this in its first request of a class only.
  bool isFirstUse() const { return step_ == &kFinding || isGroups_; }

  // The codes that a fault of the call may lead to.
  std::set<uint64_t> codes(const FileCall& call) const {
    // A directory of the configuration that cannot be looked after is logged, and used all the
    // same. It may turn out to be missing when the class is read.
    if (step_ == &kFinding) {
      if (call.name == "getdents64") return {kFinding.code};
      return {kSuccess, kFinding.code};
    }
    if (isConfiguration_) return {kSuccess};
    // What was last known of the groups will do.
    if (isGroups_) return {kSuccess, kList.code};
    return {step_->code};
  }

 private:
  static bool isUUID(const std::string& name) { return platform::UUID::parse(name).has_value(); }

  void name(const FileCall& call) {
    const std::string& path = call.path;
    // Not a name in an open directory, nor the descriptor of one as a path.
    const bool isWhole = path.find('/') != std::string::npos && !path.starts_with('/');
    if (isWhole) isGroups_ = path == "etc/group";
    if (isWhole) isConfiguration_ = !call.locatesOnly && !isGroups_ && !isInStaging(path);
    if (isGroups_) step_ = &kList;
    if (isWhole && isInStaging(path)) {
      const size_t end = path.find('/', path.find("/Staging/") + 9);
      if (step_ == &kFinding) step_ = &kStaging;
      if (end != std::string::npos) step_ = &kSubdirectories;
    }
    if (isConfiguration_ && step_ == &kStaging) step_ = &kMetadata;
    if (isConfiguration_ && step_ == &kSubdirectories) step_ = &kMoving;
  }

  static bool isInStaging(const std::string& path) {
    return path.find("/Staging/") != std::string::npos;
  }

  const Step* step_ = &kFinding;
  bool isConfiguration_ = false;
  bool isGroups_ = false;
  bool isMoved_ = false;
};

class CreationFault : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root";
    if (const std::string why = whyNotTraceable(); !why.empty()) GTEST_SKIP() << why;
    device_.emplace(quickParent());
    start();
  }

  void start() {
    device_->kill();
    startAndCleanUp(*device_);
    client_.emplace(device_->connect(privilegedCaller()));
    ASSERT_TRUE(client_->personaList().has_value());
  }

  // The answer's code: 1 for success.
  uint64_t create(const Creation& creation, const CallJudge& judge) {
    uint64_t code = 0;
    calls_ = traceRequest(
        device_->daemonPid(),
        [&] {
          const auto made = creation.request(*client_);
          code = made ? kSuccess : made.error().code;
        },
        judge);
    return code;
  }

  Creation newCreation(uint64_t containerClass) {
    return {containerClass, fmt::format("com.example.app{}", ++creations_)};
  }

  // Creates undisturbed; the first of its class says what a whole container is.
  void learn(const Creation& creation) {
    ASSERT_EQ(create(creation, [](const FileCall&, size_t) { return Verdict{}; }), kSuccess);
    const auto made = creation.request(*client_);
    ASSERT_TRUE(made.has_value());
    model_ = pictureOf(made->path);
    live_ = itemsIn(*device_, creation.classDirectory()).size();
  }

  // Nothing half-built is left, and the next request has its container.
  void expectSound(const Creation& creation, bool wasMade) {
    EXPECT_EQ(litterThatStays(*device_, creation, kTemporaryMetadata), "");
    EXPECT_EQ(itemsIn(*device_, creation.classDirectory()).size(), live_ + (wasMade ? 1 : 0));
    const auto next = creation.request(*client_);
    ASSERT_TRUE(next.has_value()) << next.error().text << next.error().code;
    EXPECT_EQ(next->existed, wasMade);
    EXPECT_EQ(defectOf(creation, next->path, model_), "");
    live_ = itemsIn(*device_, creation.classDirectory()).size();
  }

  // Lets call `number` of a creation fail. Returns whether there was such a call.
  bool failOnce(const Creation& creation, size_t number, int error) {
    Progress progress;
    std::set<uint64_t> expected;
    std::string at;
    const uint64_t code = create(creation, [&](const FileCall& call, size_t n) {
      if (n <= number) progress.follow(call);
      if (n != number) return Verdict{};
      expected = progress.codes(call);
      at = fmt::format("{}: {} {}", progress.step().name, call.name, call.path);
      return Verdict{Verdict::Kind::fail, error};
    });
    SCOPED_TRACE(fmt::format("call {}, {}, {}", number, at, std::strerror(error)));
    if (at.empty()) return false;
    EXPECT_TRUE(expected.contains(code)) << code;
    expectSound(creation, code == kSuccess);
    return true;
  }

  std::optional<Device> device_;
  std::optional<tessary::Client> client_;
  std::map<std::string, std::string> model_;
  size_t live_ = 0;  // containers of the class
  std::vector<FileCall> calls_;
  int creations_ = 0;
};

class CreationFaultOf : public CreationFault, public ::testing::WithParamInterface<uint64_t> {};

TEST_P(CreationFaultOf, GivesTheCodeOfTheStepAndLeavesNothing) {
  constexpr std::array<int, 3> kErrors = {EIO, ENOSPC, EACCES};
  learn(newCreation(GetParam()));
  size_t faults = 0;
  for (size_t number = 0; !HasFailure(); number += kSanitizedStride) {
    const int error = kErrors[number % kErrors.size()];
    if (!failOnce(newCreation(GetParam()), number, error)) break;
    ++faults;
  }
  EXPECT_GT(faults, 50 / kSanitizedStride);
  fmt::print("class {:2} {:4} faults\n", GetParam(), faults);
}

// The first request of a daemon makes the class directory, reads it, and reads the groups.
TEST_P(CreationFaultOf, OfTheFirstRequestIsNotRemembered) {
  const auto startAfresh = [&] {
    device_->kill();
    std::filesystem::remove_all(device_->path("/private/var/mobile/Containers"));
    std::filesystem::remove_all(device_->path("/private/var/containers"));
    start();
    live_ = 0;
  };
  startAfresh();
  learn(newCreation(GetParam()));
  const std::vector<FileCall> calls = calls_;
  Progress progress;
  size_t faults = 0;
  for (size_t number = 0; number < calls.size() && !HasFailure(); ++number) {
    progress.follow(calls[number]);
    if (!progress.isFirstUse() || number % kSanitizedStride != 0) continue;
    startAfresh();
    EXPECT_TRUE(failOnce(newCreation(GetParam()), number, EIO));
    ++faults;
  }
  fmt::print("class {:2} {:4} faults in the first request\n", GetParam(), faults);
}

// The disk goes for good in the middle of a request, and is there again for the next one.
TEST_P(CreationFaultOf, SurvivesADiskThatIsGone) {
  const Creation first = newCreation(GetParam());
  learn(first);
  const size_t count = calls_.size();
  for (size_t from = 0; from < count; from += 7 * kSanitizedStride) {
    SCOPED_TRACE(from);
    const Creation creation = newCreation(GetParam());
    Progress progress;
    const uint64_t code = create(creation, [&](const FileCall& call, size_t n) {
      if (n <= from) progress.follow(call);
      return n < from ? Verdict{} : Verdict{Verdict::Kind::fail, EIO};
    });
    const bool isBuilt =
        progress.step().code == kMetadata.code || progress.step().code == kList.code ||
        progress.step().code == kSubdirectories.code || progress.step().code == kMoving.code;
    // What is in staging cannot be got rid of either.
    EXPECT_TRUE(!isBuilt || code == 9U) << code << ' ' << progress.step().name;
    EXPECT_NE(code, 0U);
    EXPECT_EQ(itemsIn(*device_, creation.classDirectory()).size(),
              live_ + (code == kSuccess ? 1 : 0));
    const auto next = creation.request(*client_);
    ASSERT_TRUE(next.has_value()) << next.error().text;
    EXPECT_EQ(defectOf(creation, next->path, model_), "");
    ++live_;
  }
  EXPECT_FALSE(itemsIn(*device_, first.stagingDirectory()).empty());
  start();
  EXPECT_EQ(litterThatStays(*device_, first), "");
}

INSTANTIATE_TEST_SUITE_P(Class, CreationFaultOf, ::testing::Values(2, 12, 13),
                         [](const auto& each) { return std::to_string(each.param); });

struct Message {
  uint64_t containerClass;
  const char* call;
  const char* pathPart;
  int occurrence;  // among those calls, from 1
  uint64_t code;
  const char* text;
};

TEST_F(CreationFault, WritesTheMessageOfTheStep) {
  const Message kMessages[] = {
      {2, "mkdirat", "-", 1, 7, "Failed to create staging dir at "},
      {2, "openat", kTemporaryMetadata, 1, 34, "Failed to write metadata dictionary to URL "},
      {2, "write", "", 1, 34, "Failed to write metadata dictionary to URL "},
      {2, "fsync", "", 1, 34, "Failed to write metadata dictionary to URL "},
      {2, "renameat", kTemporaryMetadata, 1, 34, "Failed to move metadata from staging: "},
      {12, "setxattr", "/proc/self/fd/", 1, 63, "Failed to set ACL on "},
      {13, "setxattr", "/proc/self/fd/", 2, 63, "Failed to set ACL on "},
      {2, "mkdirat", "SystemData", 1, 6, "Failed to create sub-dir for "},
      {2, "fchown", "", 2, 6, "Failed to create sub-dir for "},
      {12, "mkdirat", "tmp", 1, 6, "Failed to create sub-dir for "},
      {2, "renameat", "-", 2, 8, "Failed to move staging dir: "},
      {2, "write", "", 2, kSuccess, "Failed to set mapping for user: "},
  };
  for (const uint64_t containerClass : {2U, 12U, 13U}) learn(newCreation(containerClass));
  for (const Message& message : kMessages) {
    SCOPED_TRACE(fmt::format("{} {} {}", message.call, message.pathPart, message.occurrence));
    const Creation creation = newCreation(message.containerClass);
    int seen = 0;
    const uint64_t code = create(creation, [&](const FileCall& call, size_t) {
      const bool isMeant =
          call.name == message.call && call.path.find(message.pathPart) != std::string::npos;
      if (!isMeant || ++seen != message.occurrence) return Verdict{};
      return Verdict{Verdict::Kind::fail, EIO};
    });
    EXPECT_EQ(code, message.code);
    EXPECT_NE(device_->daemonLog().find(message.text), std::string::npos);
    // The next message is looked for in a log of its own.
    std::filesystem::resize_file(
        device_->path("/private/var/root/Library/Logs/Tessary/tessaryd.log"), 0);
  }
}

// The emptying may find the directory on death row before the container has come into it.
TEST_F(CreationFault, DeathRowEmptiedUnderAMove) {
  const Creation creation{2, "com.example.app", /*transient=*/true};
  const auto old = creation.request(*client_);
  ASSERT_TRUE(old.has_value());
  ASSERT_EQ(litterThatStays(*device_, creation), "");  // what the start has thrown away
  const std::string name = std::filesystem::path(old->path).filename();
  bool wasEmptied = false;
  const uint64_t code = create(creation, [&](const FileCall& call, size_t) {
    if (wasEmptied || call.name != "renameat" || call.path != name) return Verdict{};
    wasEmptied = true;
    for (const auto& item : itemsIn(*device_, kDeathRow)) {
      std::error_code ignored;
      std::filesystem::remove(device_->path(kDeathRow + ("/" + item)), ignored);
    }
    return Verdict{};
  });
  EXPECT_TRUE(wasEmptied);
  EXPECT_EQ(code, kSuccess);
  EXPECT_EQ(itemsIn(*device_, creation.classDirectory()).size(), 1U);
}

}  // namespace

// Each call to the file system that a creation makes fails. The answer is the code of the step that
// it belongs to, what was built is on its way out, and the next request succeeds.
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
constexpr uint64_t kNotCleanedUp = 9;
constexpr char kTemporaryMetadata[] = "temp_metadata-";

struct Step {
  uint64_t code;
  const char* message;  // in the log
  bool hasBuilt = false;
};
constexpr Step kFinding{43, ""};
constexpr Step kStaging{7, "Failed to create staging dir at "};
constexpr Step kMetadata{34, " metadata ", true};
constexpr Step kList{63, "Failed to set ACL on ", true};
constexpr Step kSubdirectories{6, "Failed to create sub-dir for ", true};
constexpr Step kMoving{8, "Failed to move staging dir: ", true};
constexpr Step kEntering{kSuccess, ""};

// Follows a creation through its steps by the paths that its calls name. A call without one belongs
// to what was named last.
class Progress {
 public:
  void follow(const FileCall& call) {
    call_ = call;
    if (isMoved_) step_ = &kEntering;
    if (!call.path.empty()) name(call);
    if (call.name == "renameat" && platform::UUID::parse(call.path)) isMoved_ = true;
  }

  const Step& step() const { return *step_; }

  // Whether a daemon does this in its first request of a class only.
  bool isFirstUse() const { return step_ == &kFinding || isGroups_; }

  // The codes that a fault of the last call may lead to.
  std::set<uint64_t> codes() const {
    // A directory of the configuration that cannot be looked after is logged, and used all the
    // same. It may turn out to be missing when the class is read.
    if (step_ == &kFinding) {
      if (call_.name == "getdents64") return {kFinding.code};
      return {kSuccess, kFinding.code};
    }
    if (isConfiguration_) return {kSuccess};
    // What was last known of the groups will do.
    if (isGroups_) return {kSuccess, kList.code};
    return {step_->code};
  }

 private:
  void name(const FileCall& call) {
    const std::string& path = call.path;
    // Not a name in an open directory, nor the descriptor of one as a path.
    const bool isWhole = path.find('/') != std::string::npos && !path.starts_with('/');
    const bool isInStaging = path.find("/Staging/") != std::string::npos;
    if (isWhole) isGroups_ = path == "etc/group";
    if (isWhole) isConfiguration_ = !call.locatesOnly && !isGroups_ && !isInStaging;
    if (isGroups_) step_ = &kList;
    if (isWhole && isInStaging) {
      const size_t end = path.find('/', path.find("/Staging/") + 9);
      if (step_ == &kFinding) step_ = &kStaging;
      if (end != std::string::npos) step_ = &kSubdirectories;
    }
    if (isConfiguration_ && step_ == &kStaging) step_ = &kMetadata;
    if (isConfiguration_ && step_ == &kSubdirectories) step_ = &kMoving;
  }

  FileCall call_;
  const Step* step_ = &kFinding;
  bool isConfiguration_ = false;
  bool isGroups_ = false;
  bool isMoved_ = false;
};

class CreationFault : public ::testing::TestWithParam<uint64_t> {
 protected:
  void SetUp() override {
    if (const std::string why = whyNotTraceable(); !why.empty()) GTEST_SKIP() << why;
    device_.emplace(quickParent());
    startAfresh();
    learn();
  }

  // A daemon that has served nothing, on a device without containers.
  void startAfresh() {
    device_->kill();
    std::filesystem::remove_all(device_->path("/private/var/mobile/Containers"));
    std::filesystem::remove_all(device_->path("/private/var/containers"));
    startAndCleanUp(*device_);
    client_.emplace(device_->connect(privilegedCaller()));
    live_ = 0;
  }

  Creation newCreation() { return {GetParam(), fmt::format("com.example.app{}", ++creations_)}; }

  std::vector<FileCall> create(const Creation& creation, const CallJudge& judge) {
    return traceRequest(
        device_->daemonPid(),
        [&] {
          const auto made = creation.request(*client_);
          code_ = made ? kSuccess : made.error().code;
        },
        judge);
  }

  // Creates undisturbed, and says what a whole container is from now on.
  void learn() {
    const Creation creation = newCreation();
    firstCalls_ = create(creation, [](const FileCall&, size_t) { return Verdict{}; });
    const auto made = creation.request(*client_);
    ASSERT_TRUE(made.has_value());
    model_ = pictureOf(made->path);
    ++live_;
  }

  // Lets call `number` of a creation fail, and, with `isForGood`, all that follow. Returns whether
  // there was such a call.
  bool fail(size_t number, int error, bool isForGood = false) {
    const Creation creation = newCreation();
    const size_t logged = device_->daemonLog().size();
    Progress progress;
    std::string at;
    create(creation, [&](const FileCall& call, size_t n) {
      if (n <= number) progress.follow(call);
      if (n == number) at = fmt::format("{} {}", call.name, call.path);
      const bool fails = isForGood ? n >= number : n == number;
      return fails ? Verdict{Verdict::Kind::fail, error} : Verdict{};
    });
    if (at.empty()) return false;
    const Step& step = progress.step();
    SCOPED_TRACE(fmt::format("call {}, {}: {}, code {}", number, at, std::strerror(error), code_));
    if (isForGood) {
      // What is in staging cannot be got rid of either.
      EXPECT_TRUE(!step.hasBuilt || code_ == kNotCleanedUp);
      EXPECT_NE(code_, 0U);
    } else {
      EXPECT_TRUE(progress.codes().contains(code_));
      EXPECT_TRUE(code_ != step.code ||
                  device_->daemonLog().find(step.message, logged) != std::string::npos);
      EXPECT_EQ(litterThatStays(*device_, creation, kTemporaryMetadata), "");
    }
    if (code_ == kSuccess) ++live_;
    EXPECT_EQ(itemsIn(*device_, creation.classDirectory()).size(), live_);
    const auto next = creation.request(*client_);
    EXPECT_TRUE(next.has_value()) << (next ? "" : next.error().text);
    if (!next) return false;
    EXPECT_EQ(next->existed, code_ == kSuccess);
    EXPECT_EQ(defectOf(creation, next->path, model_), "");
    if (code_ != kSuccess) ++live_;
    return true;
  }

  std::optional<Device> device_;
  std::optional<tessary::Client> client_;
  Picture model_;
  std::vector<FileCall> firstCalls_;  // of a daemon's first request of the class
  size_t live_ = 0;                   // containers of the class
  uint64_t code_ = 0;                 // of the last answer: 1 for success
  int creations_ = 0;
};

TEST_P(CreationFault, GivesTheCodeOfTheStepAndLeavesNothing) {
  constexpr std::array<int, 3> kErrors = {EIO, ENOSPC, EACCES};
  size_t number = 0;
  while (!HasFailure() && fail(number, kErrors[number % 3])) number += kSanitizedStride;
  EXPECT_GT(number, 50U);
}

// The first request of a daemon makes the class directory, reads it, and reads the groups.
TEST_P(CreationFault, OfTheFirstRequestIsNotRemembered) {
  Progress progress;
  for (size_t number = 0; number < firstCalls_.size() && !HasFailure(); ++number) {
    progress.follow(firstCalls_[number]);
    if (!progress.isFirstUse() || number % kSanitizedStride != 0) continue;
    startAfresh();
    EXPECT_TRUE(fail(number, EIO));
  }
}

// The disk goes for good in the middle of a request, and is there again for the next one.
TEST_P(CreationFault, OfAllCallsFromOneOnIsSurvived) {
  size_t number = 0;
  while (!HasFailure() && fail(number, EIO, /*isForGood=*/true)) number += 7 * kSanitizedStride;
  EXPECT_GT(number, 50U);
  const Creation creation = newCreation();
  EXPECT_FALSE(itemsIn(*device_, creation.stagingDirectory()).empty());
  device_->kill();
  startAndCleanUp(*device_);
  EXPECT_EQ(litterThatStays(*device_, creation), "");
}

// The emptying may find the directory on death row before the container has come into it.
TEST_P(CreationFault, OfADeathRowThatIsEmptiedUnderAMoveIsNone) {
  const Creation creation{GetParam(), "com.example.app", /*transient=*/true};
  const auto old = creation.request(*client_);
  ASSERT_TRUE(old.has_value());
  const std::string name = std::filesystem::path(old->path).filename();
  bool wasEmptied = false;
  create(creation, [&](const FileCall& call, size_t) {
    if (wasEmptied || call.name != "renameat" || call.path != name) return Verdict{};
    wasEmptied = true;
    for (const auto& item : itemsIn(*device_, kDeathRow)) {
      std::error_code ignored;
      std::filesystem::remove(device_->path(kDeathRow + ("/" + item)), ignored);
    }
    return Verdict{};
  });
  EXPECT_TRUE(wasEmptied);
  EXPECT_EQ(code_, kSuccess);
}

INSTANTIATE_TEST_SUITE_P(OfClass, CreationFault, ::testing::Values(2, 12),
                         [](const auto& each) { return std::to_string(each.param); });

}  // namespace

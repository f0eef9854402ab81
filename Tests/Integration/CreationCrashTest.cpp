// The daemon is killed at each system call of a creation in turn. After the next start there is a
// whole container or none, and nothing of the attempt stays behind.
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Integration/SystemCalls.h"

namespace {

// Of a transient container there was one before, whose place the new one takes.
const Creation kCreations[] = {
    {2, "com.example.app"},
    {2, "com.example.app", /*transient=*/true},
    {12, "com.veltra.exampled"},
    {13, "systemgroup.com.veltra.palette"},
};

class CreationCrash : public ::testing::TestWithParam<Creation> {
 protected:
  void SetUp() override {
    if (const std::string why = whyNotTraceable(); !why.empty()) GTEST_SKIP() << why;
    device_.emplace(quickParent());
  }

  const Creation& creation() const { return GetParam(); }
  tessary::Client connect() const { return device_->connect(privilegedCaller()); }

  // A device on which there never was a container, with its daemon.
  void startAfresh() {
    device_->kill();
    for (const char* tree : {"/private/var/mobile/Containers", "/private/var/containers",
                             "/private/var/root/Library/Caches", "/run/tessary/sandbox/mappings"}) {
      std::filesystem::remove_all(device_->path(tree));
    }
    // The emptying of death row at the start would make some creations longer than others.
    startAndCleanUp(*device_);
    tessary::Client client = connect();
    EXPECT_TRUE(!creation().transient || creation().request(client));
  }

  std::vector<FileCall> create(const CallJudge& judge) {
    startAfresh();
    tessary::Client client = connect();
    return traceRequest(
        device_->daemonPid(), [&] { answered_ = creation().request(client).has_value(); }, judge);
  }

  // The containers at live paths, every one of which must be whole.
  size_t countLive() const {
    const auto names = itemsIn(*device_, creation().classDirectory());
    for (const std::string& name : names) {
      const std::string path = device_->path(creation().classDirectory() + "/" + name);
      EXPECT_EQ(defectOf(creation(), path, model_), "");
    }
    return names.size();
  }

  bool isMapped(const std::string& path) const {
    std::ifstream log(device_->path("/run/tessary/sandbox/mappings"));
    const std::string text{std::istreambuf_iterator<char>(log), {}};
    return text.find('\t' + path + '\n') != std::string::npos;
  }

  // Kills the daemon at call `number`, starts it again and looks at what there is.
  void crash(size_t number, const FileCall& call, Verdict::Kind kind) {
    SCOPED_TRACE(fmt::format("killed {} call {}: {} {}",
                             kind == Verdict::Kind::killBefore ? "before" : "after", number,
                             call.name, call.path));
    create([&](const FileCall&, size_t n) { return n == number ? Verdict{kind} : Verdict{}; });
    device_->kill();
    EXPECT_FALSE(answered_);
    const size_t alive = countLive();
    EXPECT_LE(alive, 1U);
    ++points_;
    if (!itemsIn(*device_, creation().stagingDirectory()).empty()) ++litter_;

    device_->start();
    EXPECT_EQ(litterThatStays(*device_, creation()), "");
    tessary::Client client = connect();
    const bool isKept = !creation().transient && alive > 0;
    EXPECT_TRUE(creation().transient || creation().lookUp(client).has_value() == isKept);
    const auto next = creation().request(client);
    ASSERT_TRUE(next.has_value()) << next.error().text << device_->daemonLog();
    EXPECT_EQ(next->existed, isKept);
    EXPECT_EQ(defectOf(creation(), next->path, model_), "");
    EXPECT_EQ(countLive(), 1U);
    EXPECT_TRUE(creation().transient || isMapped(next->path));
  }

  std::optional<Device> device_;
  Picture model_;
  bool answered_ = false;
  size_t points_ = 0;
  size_t litter_ = 0;  // kill points that left something in staging
};

TEST_P(CreationCrash, LeavesAWholeContainerOrNone) {
  const std::vector<FileCall> calls = create([](const FileCall&, size_t) { return Verdict{}; });
  ASSERT_TRUE(answered_);
  ASSERT_GT(calls.size(), 50U);
  const auto made = itemsIn(*device_, creation().classDirectory());
  ASSERT_EQ(made.size(), 1U);
  model_ = pictureOf(device_->path(creation().classDirectory() + "/" + made[0]));
  for (size_t number = 0; number < calls.size() && !HasFailure(); number += kSanitizedStride) {
    crash(number, calls[number], Verdict::Kind::killBefore);
    if (calls[number].changes) crash(number, calls[number], Verdict::Kind::killAfter);
  }
  // Otherwise the calls that were counted are not those of a creation.
  EXPECT_GT(litter_, points_ / 4);
}

INSTANTIATE_TEST_SUITE_P(Of, CreationCrash, ::testing::ValuesIn(kCreations), [](const auto& each) {
  return fmt::format("Class{}{}", each.param.containerClass, each.param.transient ? "Temp" : "");
});

}  // namespace

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

struct Operation {
  const char* name;
  Creation creation;
  bool hasPredecessor;  // another container of the class, for a transient one the same, is there
  bool atEveryCall;     // not only around those that change the disk

  // In the name of the test case.
  friend void PrintTo(const Operation& operation, std::ostream* stream) {
    *stream << operation.name;
  }
};

const Operation kOperations[] = {
    {"FirstAppData", {2, "com.example.app"}, false, true},
    {"AnotherAppData", {2, "com.example.app"}, true, false},
    {"TransientAgain", {2, "com.example.app", /*transient=*/true}, true, false},
    {"SystemData", {12, "com.veltra.exampled"}, false, true},
    {"SystemGroup", {13, "systemgroup.com.veltra.palette"}, false, true},
};

class CreationCrash : public ::testing::TestWithParam<Operation> {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root";
    if (const std::string why = whyNotTraceable(); !why.empty()) GTEST_SKIP() << why;
    device_.emplace(quickParent());
  }

  const Operation& operation() const { return GetParam(); }
  const Creation& creation() const { return operation().creation; }
  Creation predecessor() const {
    Creation before = creation();
    if (!before.transient) before.identifier = "com.example.before";
    return before;
  }

  tessary::Client connect() const {
    tessary::Client client = device_->connect(privilegedCaller());
    // Answered: accepted, and nothing but the next request will be done for it.
    EXPECT_TRUE(client.personaList().has_value());
    return client;
  }

  // A device on which there never was a container, with its daemon.
  void startAfresh() {
    device_->kill();
    std::filesystem::remove_all(device_->path("/private/var/mobile/Containers"));
    std::filesystem::remove_all(device_->path("/private/var/containers"));
    std::filesystem::remove_all(device_->path("/private/var/root/Library/Caches"));
    std::filesystem::remove(device_->path("/run/tessary/sandbox/mappings"));
    // The emptying of death row at the start would make some creations longer than others.
    startAndCleanUp(*device_);
    if (!operation().hasPredecessor) return;
    tessary::Client client = connect();
    EXPECT_TRUE(predecessor().request(client).has_value());
  }

  std::vector<FileCall> create(const CallJudge& judge) {
    tessary::Client client = connect();
    return traceRequest(
        device_->daemonPid(), [&] { answered_ = creation().request(client).has_value(); }, judge);
  }

  // Creates undisturbed, and says what a whole container is from now on.
  std::vector<FileCall> learn() {
    startAfresh();
    auto calls = create([](const FileCall&, size_t) { return Verdict{}; });
    EXPECT_TRUE(answered_);
    tessary::Client client = connect();
    const auto made = creation().request(client);
    if (made) model_ = pictureOf(made->path);
    return calls;
  }

  // The containers at live paths, every one of which must be whole. The predecessor counts.
  size_t countLive() const {
    size_t count = 0;
    const std::string directory = creation().classDirectory();
    for (const std::string& name : itemsIn(*device_, directory)) {
      ++count;
      const std::string path = device_->path(directory + "/" + name);
      const std::string defect = defectOf(creation(), path, model_);
      const std::string other = defectOf(predecessor(), path, model_);
      if (!defect.empty() && !other.empty()) ADD_FAILURE() << defect << '\n' << other;
    }
    return count;
  }

  bool isMapped(const std::string& path) const {
    std::ifstream log(device_->path("/run/tessary/sandbox/mappings"));
    const std::string text{std::istreambuf_iterator<char>(log), {}};
    return text.find('\t' + path + '\n') != std::string::npos;
  }

  // Kills the daemon at call `number`, starts it again and looks at what there is.
  void crash(size_t number, Verdict::Kind kind) {
    startAfresh();
    std::string at;
    create([&](const FileCall& call, size_t n) {
      if (n == number) at = call.name + " " + call.path;
      return n == number ? Verdict{kind} : Verdict{};
    });
    device_->kill();
    SCOPED_TRACE(fmt::format("killed {} call {}: {}",
                             kind == Verdict::Kind::killBefore ? "before" : "after", number, at));
    EXPECT_FALSE(answered_);
    const size_t alive = countLive();
    const size_t others = operation().hasPredecessor && !creation().transient ? 1 : 0;
    EXPECT_LE(alive, others + 1);
    if (!itemsIn(*device_, creation().stagingDirectory()).empty()) ++litter_;

    device_->start();
    EXPECT_EQ(litterThatStays(*device_, creation()), "");
    tessary::Client client = connect();
    if (!creation().transient) {
      EXPECT_EQ(creation().lookUp(client).has_value(), alive > others);
    }
    const auto next = creation().request(client);
    ASSERT_TRUE(next.has_value()) << next.error().text << device_->daemonLog();
    EXPECT_EQ(next->existed, !creation().transient && alive > others);
    EXPECT_EQ(defectOf(creation(), next->path, model_), "");
    EXPECT_EQ(countLive(), others + 1);
    EXPECT_TRUE(creation().transient || isMapped(next->path));
  }

  std::optional<Device> device_;
  std::map<std::string, std::string> model_;
  bool answered_ = false;
  size_t litter_ = 0;  // kill points that left something in staging
};

TEST_P(CreationCrash, LeavesAWholeContainerOrNone) {
  const std::vector<FileCall> calls = learn();
  ASSERT_GT(calls.size(), 50U);
  size_t candidates = 0;
  size_t points = 0;
  for (size_t number = 0; number < calls.size() && !HasFailure(); ++number) {
    if (!calls[number].changes && !operation().atEveryCall) continue;
    if (candidates++ % kSanitizedStride != 0) continue;
    ++points;
    crash(number, Verdict::Kind::killBefore);
    if (!calls[number].changes) continue;
    ++points;
    crash(number, Verdict::Kind::killAfter);
  }
  fmt::print("{:<16} {:4} calls {:4} kill points, {:4} with litter\n", operation().name,
             calls.size(), points, litter_);
  // Otherwise the calls that were counted are not those of a creation.
  EXPECT_GT(litter_, points / 4);
}

INSTANTIATE_TEST_SUITE_P(Each, CreationCrash, ::testing::ValuesIn(kOperations),
                         [](const auto& each) { return std::string(each.param.name); });

}  // namespace

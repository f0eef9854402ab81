// Operations that change existing containers are interrupted at each system call: the daemon is
// killed, or the call fails. What is there afterwards is what was there before or what was asked
// for, whole; the daemon sees what the disk has, and nothing of the attempt stays behind.
#include <fmt/format.h>
#include <gtest/gtest.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>

#include "Platform/values/PropertyList.h"
#include "Platform/values/UUID.h"
#include "Tests/Integration/ContainerState.h"
#include "Tests/Integration/SanitizedBuild.h"
#include "Tests/Integration/SystemCalls.h"

namespace {

using platform::UUID;
using platform::Value;
using tessary::Client;
using tessary::ContainerName;

constexpr uint64_t kSuccess = 1;
constexpr uint64_t kRemoveFileFailed = 36;
constexpr char kContent[] = "/Documents/content";
constexpr char kJournals[] = "/private/var/root/Library/Tessary/Replace";
constexpr char kInfoKey[] = "key";

const Creation kRegular{2, "com.example.app"};
const Creation kTransient{2, "com.example.app", /*transient=*/true};

// The containers before the operation: a regular one with the content and the info "old", and a
// transient one with the content "new".
struct Situation {
  // One that is not there has a UUID that nobody has.
  ContainerName old{"com.example.app", 2, UUID::random(), std::nullopt};
  ContainerName replacement = old;
  std::string oldDirectory;
};

constexpr char kOld[] = "regular(uuid old, content old, info old)";
constexpr char kNew[] = " transient(uuid new, content new, info none)";

struct Operation {
  const char* name;
  tessary::Result<void> (*request)(Client& client, const Situation& situation);
  // What is on the disk, as stateOnDisk() tells it.
  std::string before;
  std::string after;
  std::set<uint64_t> codes;  // that a failing call may lead to
  bool hasRegular = true;
  bool hasTransient = false;
};

const std::array kOperations = {
    Operation{"Replace",
              [](Client& client, const Situation& situation) {
                return client.replaceContainer(situation.old, situation.replacement);
              },
              std::string(kOld) + kNew,
              "regular(uuid new, content new, info none)",
              {14, 15, 34, 36},
              /*hasRegular=*/true,
              /*hasTransient=*/true},
    Operation{"Promote",
              [](Client& client, const Situation& situation) {
                return client.promoteContainer(situation.replacement);
              },
              kNew,
              "regular(uuid new, content new, info none)",
              {15},
              /*hasRegular=*/false,
              /*hasTransient=*/true},
    // With the old UUID kept. The empty container that is made for it may stay where it was made.
    Operation{"Wipe",
              [](Client& client, const Situation&) {
                return client.deleteDataContent("com.example.app", 2);
              },
              kOld,
              "regular(uuid old, content none, info none)",
              {5, 6, 7, 8, 14, 15, 34, 36, 43}},
    Operation{"StageForDelete",
              [](Client& client, const Situation& situation) {
                return client.stageForDelete({situation.old});
              },
              kOld,
              "",
              {}},
    Operation{"RegenerateUUID",
              [](Client& client, const Situation& situation) {
                return client.regenerateUUID(situation.old);
              },
              kOld,
              "regular(uuid old, content old, info old, renamed)",
              {48}},
    Operation{"SetInfoValue",
              [](Client& client, const Situation& situation) {
                return client.setInfoValue(situation.old, kInfoKey, Value("new"));
              },
              kOld,
              "regular(uuid old, content old, info new)",
              {34}},
};

void PrintTo(const Operation& operation, std::ostream* stream) {
  *stream << operation.name;
}

// Short ones are gone through whole.
size_t strideOver(const std::vector<FileCall>& calls) {
  constexpr size_t kManyCalls = 40;
  return calls.size() < kManyCalls ? 1 : kSanitizedStride;
}

class Interruption : public ::testing::TestWithParam<Operation> {
 protected:
  void SetUp() override {
    if (const std::string why = whyNotTraceable(); !why.empty()) GTEST_SKIP() << why;
    device_.emplace(quickParent());
    device_->start();
    const auto plain = kRegular.request(connectTo());
    ASSERT_TRUE(plain.has_value());
    model_ = pictureOf(plain->path);
  }

  const Operation& operation() const { return GetParam(); }
  Client& connectTo() {
    return client_.emplace(device_->connect(privilegedCaller().with("deleteContainerContent")));
  }

  // A device with the situation and nothing else, and its daemon.
  void startAfresh() {
    client_.reset();
    device_->kill();
    for (const char* tree : {"/private/var/mobile/Containers", "/private/var/root/Library/Caches",
                             "/run/tessary/sandbox/mappings"}) {
      std::filesystem::remove_all(device_->path(tree));
    }
    startAndCleanUp(*device_);
    Client& client = connectTo();
    situation_ = Situation();
    if (operation().hasRegular) {
      situation_.old = make(kRegular, "old", situation_.oldDirectory);
      ASSERT_TRUE(client.setInfoValue(situation_.old, kInfoKey, Value("old")).has_value());
    }
    std::string ignored;
    if (operation().hasTransient) situation_.replacement = make(kTransient, "new", ignored);
    ASSERT_EQ(stateOnDisk(), operation().before);
  }

  ContainerName make(const Creation& creation, const char* content, std::string& directory) {
    const auto made = creation.request(*client_);
    if (!made) throw std::runtime_error(made.error().text);
    std::ofstream(made->path + kContent) << content;
    directory = made->path;
    return {creation.identifier, creation.containerClass, made->uuid, std::nullopt};
  }

  std::vector<FileCall> run(const CallJudge& judge) {
    code_ = 0;
    return traceRequest(
        device_->daemonPid(),
        [&] {
          const auto done = operation().request(*client_, situation_);
          code_ = done ? kSuccess : done.error().code;
        },
        judge);
  }

  // Each container with what tells it from the others. It must be whole.
  std::string stateOf(const std::string& path) {
    Picture picture = pictureOf(path);
    picture.erase(kContent);
    EXPECT_EQ(picture, model_) << path;
    const std::string bytes = contentOf(path + "/.com.veltra.tessary.metadata.plist");
    const auto value =
        platform::readPropertyList({reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size()});
    const Value* uuid = value ? value->find("TSYMetadataUUID") : nullptr;
    if (uuid == nullptr || uuid->asString() == nullptr) return "no metadata";
    const Value* info = value->find("TSYMetadataInfo");
    const Value* infoValue = info == nullptr ? nullptr : info->find(kInfoKey);
    const std::string content = contentOf(path + kContent);
    const bool isOld = *uuid->asString() == situation_.old.uuid.string();
    const bool isNew = *uuid->asString() == situation_.replacement.uuid.string();
    const bool isRenamed =
        operation().name == std::string("RegenerateUUID") && path != situation_.oldDirectory;
    return fmt::format("uuid {}, content {}, info {}{}",
                       isOld   ? "old"
                       : isNew ? "new"
                               : "other",
                       content.empty() ? "none" : content,
                       infoValue == nullptr ? "none" : infoValue->asString()->c_str(),
                       isRenamed ? ", renamed" : "");
  }

  std::string stateOnDisk() {
    std::string state;
    for (const std::string& name : itemsIn(*device_, kRegular.classDirectory())) {
      state += "regular(" + stateOf(device_->path(kRegular.classDirectory() + "/" + name)) + ")";
    }
    if (!operation().hasTransient) return state;
    for (const std::string& name : itemsIn(*device_, kTransient.classDirectory())) {
      state +=
          " transient(" + stateOf(device_->path(kTransient.classDirectory() + "/" + name)) + ")";
    }
    return state;
  }

  // The daemon lists what is on the disk, and knows where it is.
  void expectAgreement() {
    for (const Creation& creation : {kRegular, kTransient}) {
      const auto listed = client_->containersOfClass(2, creation.transient);
      ASSERT_TRUE(listed.has_value()) << listed.error().text;
      std::set<std::string> paths;
      for (const auto& container : *listed) {
        const auto found = client_->metadata({container.identifier, 2, container.uuid, {}},
                                             /*infoRequested=*/false);
        ASSERT_TRUE(found.has_value());
        paths.insert(std::filesystem::path(found->path).filename());
      }
      const auto names = itemsIn(*device_, creation.classDirectory());
      EXPECT_EQ(paths, std::set(names.begin(), names.end()));
    }
  }

  void restart() {
    client_.reset();
    device_->kill();
    startAndCleanUp(*device_);
    connectTo();
    EXPECT_EQ(litterThatStays(*device_, kRegular), "");
    EXPECT_TRUE(itemsIn(*device_, kJournals).empty());
  }

  void crash(size_t number, const FileCall& call, Verdict::Kind kind) {
    SCOPED_TRACE(fmt::format("killed {} call {}: {} {}",
                             kind == Verdict::Kind::killBefore ? "before" : "after", number,
                             call.name, call.path));
    startAfresh();
    run([&](const FileCall&, size_t n) { return n == number ? Verdict{kind} : Verdict{}; });
    ++points_;
    restart();
    const std::string state = stateOnDisk();
    EXPECT_TRUE(state == operation().before || state == operation().after) << state;
    expectAgreement();
  }

  void fail(size_t number, const FileCall& call, int error) {
    SCOPED_TRACE(
        fmt::format("call {}, {} {}: {}", number, call.name, call.path, std::strerror(error)));
    startAfresh();
    run([&](const FileCall&, size_t n) {
      return n == number ? Verdict{Verdict::Kind::fail, error} : Verdict{};
    });
    SCOPED_TRACE(fmt::format("code {}", code_));
    EXPECT_TRUE(code_ == kSuccess || operation().codes.contains(code_));
    for (const bool isRestarted : {false, true}) {
      if (isRestarted) restart();
      const std::string state = stateOnDisk();
      const bool isDone = code_ == kSuccess || code_ == kRemoveFileFailed;
      EXPECT_EQ(state, isDone ? operation().after : operation().before);
      expectAgreement();
    }
  }

  std::optional<Device> device_;
  std::optional<Client> client_;
  Picture model_;
  Situation situation_{};
  uint64_t code_ = 0;  // 0 when there was no answer
  size_t points_ = 0;
};

TEST_P(Interruption, ByACrashLeavesTheOldOrTheNew) {
  startAfresh();
  const auto calls = run([](const FileCall&, size_t) { return Verdict{}; });
  ASSERT_EQ(code_, kSuccess);
  ASSERT_EQ(stateOnDisk(), operation().after);
  for (size_t number = 0; number < calls.size() && !HasFailure(); number += strideOver(calls)) {
    crash(number, calls[number], Verdict::Kind::killBefore);
    if (calls[number].changes) crash(number, calls[number], Verdict::Kind::killAfter);
  }
  fmt::print("kill points of {}: {}\n", operation().name, points_);
  EXPECT_GT(points_, 4U);
}

TEST_P(Interruption, ByAFailingCallLosesNothing) {
  startAfresh();
  const auto calls = run([](const FileCall&, size_t) { return Verdict{}; });
  ASSERT_EQ(code_, kSuccess);
  constexpr std::array<int, 3> kErrors = {EIO, ENOSPC, EACCES};
  for (size_t number = 0; number < calls.size() && !HasFailure(); number += strideOver(calls)) {
    fail(number, calls[number], kErrors[number % 3]);
    if (calls[number].name.starts_with("rename")) fail(number, calls[number], EXDEV);
  }
}

INSTANTIATE_TEST_SUITE_P(Of, Interruption, ::testing::ValuesIn(kOperations),
                         [](const auto& each) { return std::string(each.param.name); });

}  // namespace

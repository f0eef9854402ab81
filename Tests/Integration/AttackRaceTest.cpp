// The owner of a per-user tree swaps directories for links while the daemon works in them.
#include <fcntl.h>
#include <grp.h>
#include <linux/fs.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>

#include <atomic>
#include <new>

#include "Platform/base/FileDescriptor.h"
#include "Tests/Integration/Attack.h"

using platform::FileDescriptor;

namespace {

constexpr std::chrono::milliseconds kRaceLength{1500};
constexpr unsigned kLengths = 16384;  // a period of the generator, too

void exchange(int directory, const char* first, const char* second) {
  ::renameat2(directory, first, directory, second, RENAME_EXCHANGE);
}

// Swaps a directory for a link and back, each for times of all lengths.
[[noreturn]] void raceForDirectory(const std::string& directory, std::atomic<uint64_t>& rounds) {
  const std::string link = directory + ".swap";
  for (unsigned length = 0;;) {
    exchange(AT_FDCWD, directory.c_str(), link.c_str());
    length = (length * 5 + 3) % kLengths;
    for (unsigned i = 0; i < length; ++i) ++rounds;
  }
}

// Swaps directories in transient containers for links, and pulls others out of them; the
// descriptor leads to the container when it is on death row as well.
[[noreturn]] void raceInContainers(const std::string& home, const std::string& target,
                                   std::atomic<uint64_t>& rounds) {
  constexpr int kRounds = 100;
  constexpr int kPairs = 32;
  std::vector<std::pair<std::string, std::string>> pairs;
  for (int i = 0; i < kPairs; ++i) {
    pairs.emplace_back(fmt::format("d{}", i), fmt::format("l{}", i));
  }
  const int outside = ::open(home.c_str(), O_PATH | O_DIRECTORY);
  for (;;) {
    std::error_code ignored;
    for (const auto& item :
         fs::directory_iterator(home + "/Containers/Temp/Data/Application", ignored)) {
      const FileDescriptor container(::open(item.path().c_str(), O_RDONLY | O_DIRECTORY));
      if (!container.valid()) continue;
      for (const auto& [directory, link] : pairs) {
        (void)::mkdirat(container.get(), directory.c_str(), 0755);
        (void)::symlinkat(target.c_str(), container.get(), link.c_str());
      }
      for (int i = 0; i < kRounds; ++i, ++rounds) {
        for (const auto& [directory, link] : pairs) {
          exchange(container.get(), directory.c_str(), link.c_str());
        }
        ::renameat(container.get(), "Library/Caches", outside, "caught");
        ::renameat(outside, "caught", container.get(), "Library/Caches");
      }
    }
  }
}

class AttackDuringRequests : public Attack, public ::testing::WithParamInterface<const char*> {
 protected:
  pid_t startRacer() {
    if (isInContainers()) {
      // Relative, and right on death row: an absolute link would lead through other mounts.
      const fs::path victim = otherHome() + "/Library";
      const fs::path link = victim.lexically_relative(device_->path(kDeathRow) + "/temp/container");
      return forkAsMobile([&] { raceInContainers(home(), link, *rounds_); });
    }
    const std::string directory = home(GetParam());
    fs::create_symlink(otherHome() + "/" + GetParam(), directory + ".swap");
    return forkAsMobile([&] { raceForDirectory(directory, *rounds_); });
  }

  template <typename Action>
  pid_t forkAsMobile(const Action& action) {
    const pid_t child = ::fork();
    if (child != 0) return child;
    if (::setgroups(0, nullptr) != 0 || ::setresgid(kMobile, kMobile, kMobile) != 0 ||
        ::setresuid(kMobile, kMobile, kMobile) != 0 || ::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0) {
      ::_exit(1);
    }
    action();
    ::_exit(0);
  }

  void endRacer(pid_t racer) {
    ::kill(racer, SIGKILL);
    EXPECT_EQ(waitForExit(racer), 128 + SIGKILL);
    if (isInContainers()) return;
    const std::string directory = home(GetParam());
    if (fs::is_symlink(directory))
      exchange(AT_FDCWD, directory.c_str(), (directory + ".swap").c_str());
    fs::remove_all(directory + ".swap");
  }

  bool isInContainers() const { return GetParam()[0] == '\0'; }

  std::atomic<uint64_t>* rounds_ =
      new (::mmap(nullptr, sizeof(std::atomic<uint64_t>), PROT_READ | PROT_WRITE,
                  MAP_SHARED | MAP_ANONYMOUS, -1, 0)) std::atomic<uint64_t>(0);
};

TEST_P(AttackDuringRequests, LeadsNowhere) {
  tessary::Client creating = connect();
  tessary::Client replacing = connect();
  ASSERT_TRUE(creating.personaList() && replacing.personaList());
  const pid_t racer = startRacer();
  int done = 0;
  int requests = 0;
  {
    const Watchdog watchdog(*device_);
    const auto end = std::chrono::steady_clock::now() + kRaceLength;
    std::thread replacer([&] {
      while (std::chrono::steady_clock::now() < end) {
        (void)codeOf(replacing.createOrLookup(kApplication, 2,
                                              {.createIfNecessary = true, .transient = true}));
      }
    });
    while (std::chrono::steady_clock::now() < end) {
      const Answers answers = askAll(creating);
      ++requests;
      done += answers.created == kDone ? 1 : 0;
    }
    replacer.join();
    endRacer(racer);
    expectService();
    EXPECT_TRUE(deathRowEmpties());
  }
  EXPECT_GT(rounds_->load(), 100U);
  EXPECT_EQ(victim_->changes(), "");
  fmt::print("{:<36} {} of {} creations done\n", GetParam(), done, requests);
  if (HasFailure()) fmt::print("{}\n", device_->systemLog().substr(0, 4000));
}

INSTANTIATE_TEST_SUITE_P(OfADirectory, AttackDuringRequests,
                         ::testing::Values("Containers", "Containers/Staging", "Containers/Temp",
                                           "Containers/Data", "Containers/Data/Application",
                                           "Containers/Temp/Data/Application", ""),
                         [](const auto& tested) {
                           std::string name =
                               tested.param[0] == '\0' ? "InContainers" : tested.param;
                           std::erase(name, '/');
                           return name;
                         });

}  // namespace

// Whoever may write into a container changes it while clients manage and share what is in it:
// directories become links, and names stand for other items, during every step of the daemon's.
// Nothing outside of the container changes.
#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/prctl.h>

#include <atomic>
#include <chrono>
#include <map>
#include <memory>

#include "Tests/Integration/SharedContent.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/Integration/Watchdog.h"

namespace fs = std::filesystem;

namespace {

void swapNames(const std::string& one, const std::string& other) {
  ::renameat2(AT_FDCWD, one.c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE);
}

// The assets directory in `library`; empty when none comes for a while.
std::string newIn(const std::string& library) {
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(::opendir(library.c_str()), &::closedir);
  for (int round = 0; stream && round < 1000; ++round) {
    ::rewinddir(stream.get());
    while (const dirent* entry = ::readdir(stream.get())) {
      const std::string name = entry->d_name;
      if (name.starts_with(kAssetsPrefix)) return library + "/" + name;
    }
  }
  return {};
}

class SharedContentRace : public SharedContent {
 protected:
  // Does `attack` over and over, as a user in the group that shares system containers, until the
  // test ends it. It is given pauses of all lengths.
  template <typename Attack>
  pid_t startRacer(Attack attack) const {
    std::string line = contentOf(device_->path("/etc/group"));
    line.erase(0, line.find("systemusers:"));
    const auto group = static_cast<gid_t>(std::stoul(line.substr(line.find(":x:") + 3)));
    const pid_t child = ::fork();
    if (child != 0) return child;
    if (::setgroups(1, &group) != 0 || ::setresgid(kMobile, kMobile, kMobile) != 0 ||
        ::setresuid(kMobile, kMobile, kMobile) != 0 || ::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0) {
      ::_exit(1);
    }
    constexpr unsigned kLengths = 16384;  // a period of the generator, too
    for (unsigned length = 0;; length = (length * 5 + 3) % kLengths) {
      attack([&] {
        for (std::atomic<unsigned> i = 0; i < length; ++i) continue;
      });
    }
  }
  static void endRacer(pid_t racer) {
    ::kill(racer, SIGKILL);
    EXPECT_EQ(waitForExit(racer), 128 + SIGKILL);
  }

  // How often each code was answered in a second and a half of `ask`.
  template <typename Ask>
  static std::map<uint64_t, int> answersDuring(Ask ask) {
    std::map<uint64_t, int> counts;
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(1500);
    while (std::chrono::steady_clock::now() < end) {
      for (const uint64_t code : ask()) ++counts[code];
    }
    return counts;
  }
};

TEST_F(SharedContentRace, SwappedDirectoriesLeadNoDeletionOutside) {
  const std::string container = makeContainer(kApplication, 2);
  const std::string library = container + "/Library";
  tessary::Client client = connect();
  const std::string directory = assets(client, /*create=*/true)->path;
  makeOutside({directory.substr(container.size() + 1) + "/asset"});
  const std::string asset = directory + "/asset";
  linkOutside("Library", library + ".swap");
  linkOutside(directory.substr(container.size() + 1), directory + ".swap");
  const pid_t racer = startRacer([&](auto pause) {
    ::close(::open(asset.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
    for (int turn = 0; turn < 2; ++turn) {
      swapNames(library, library + ".swap");
      pause();
    }
    for (int turn = 0; turn < 2; ++turn) {
      swapNames(directory, directory + ".swap");
      pause();
    }
  });
  const Watchdog watchdog(*device_);
  const auto answers = answersDuring([&] { return std::vector{deleteAsset(client, "asset")}; });
  endRacer(racer);
  EXPECT_TRUE(answers.contains(kDone) && answers.contains(kInvalidPath)) << "no race";
  EXPECT_EQ(lookOutside(), picture_);
}

TEST_F(SharedContentRace, ANewAssetsDirectoryThatIsExchangedGivesNothingAway) {
  const std::string library = makeContainer(kApplication, 2) + "/Library";
  makeOutside({"Library/note"});
  linkOutside("Library", library + "/link");
  linkOutside("Library", library + ".swap");
  ASSERT_EQ(::link(openFile().c_str(), (library + "/hard").c_str()), 0);
  const std::string aside = library + "/aside";
  const std::string items[] = {library + "/link", library + "/hard"};
  const pid_t racer = startRacer([&](auto pause) {
    for (const std::string& item : items) {  // each takes the new directory's place for a while
      const std::string path = newIn(library);
      if (path.empty() || ::rename(path.c_str(), aside.c_str()) != 0) continue;
      ::rename(item.c_str(), path.c_str());
      pause();
      ::rename(path.c_str(), item.c_str());
      ::rmdir(aside.c_str());
    }
    for (int turn = 0; turn < 2; ++turn) {
      swapNames(library, library + ".swap");
      pause();
    }
  });
  const Watchdog watchdog(*device_);
  tessary::Client client = connect();
  const auto answers =
      answersDuring([&] { return std::vector{codeOf(assets(client, /*create=*/true))}; });
  endRacer(racer);
  EXPECT_TRUE(answers.contains(kDone) && answers.contains(kCreateFailed)) << "no race";
  EXPECT_EQ(lookOutside(), picture_);
}

TEST_F(SharedContentRace, SwappedDirectoriesLeadNoStagingOutside) {
  const std::string container = makeContainer(kGroup, 13);
  makeOutside({"from/item", "to/item"});
  for (const char* name : {"from", "to"}) {
    fs::create_directory(container + "/" + name);
    linkOutside(name, container + "/" + name + ".swap");
  }
  const std::string from = container + "/from";
  const std::string to = container + "/to";
  const std::string item = from + "/item";
  const pid_t racer = startRacer([&](auto pause) {
    ::close(::open(item.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0660));
    pause();
    for (const std::string& directory : {from, to, from, to}) {
      swapNames(directory, directory + ".swap");
      pause();
    }
    // An item of the container becomes one that is somebody else's, and comes and goes.
    for (int turn = 0; turn < 100; ++turn) {
      ::unlink(item.c_str());
      ::link(openFile().c_str(), item.c_str());
    }
    ::unlink(item.c_str());
  });
  const Watchdog watchdog(*device_);
  tessary::Client stager = connectStager();
  const auto answers = answersDuring([&] {
    return std::vector{stage(stager, "from/item", "to/item"),
                       stage(stager, "to/item", "from/item")};
  });
  endRacer(racer);
  EXPECT_TRUE(answers.contains(kDone) && answers.contains(kInvalidPath)) << "no race";
  EXPECT_EQ(lookOutside(), picture_);
}

}  // namespace

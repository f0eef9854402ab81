// Removing a tree that somebody else may be changing at the same time.
//
// What is no directory is unlinked by name in its open parent, and a directory is opened, without
// following a link or entering a mount, before anything in it is touched. What a name turns out to
// stand for decides, not what it stood for a moment ago: when one attempt finds something else
// there, the other one follows.
#include <fcntl.h>
#include <unistd.h>

#include "Platform/fs/DirectoryStack.h"
#include "Platform/fs/FileSystem.h"
#include "Platform/fs/OpenBeneath.h"

namespace platform {
namespace {

// How often a directory is emptied again when somebody keeps filling it.
constexpr int kEmptyings = 16;

class Removal {
 public:
  Removal(std::string path, const FileSystem::RemovalFailure& onFailure)
      : path_(std::move(path)), onFailure_(onFailure) {}

  Result<void> run(int parent, const std::string& name) {
    rootParent_ = parent;
    rootName_ = name;
    if (!removeItem(parent, name.c_str(), DT_UNKNOWN)) report(parent, name, path_);
    while (!stack_.isEmpty() && !isLost_) step();
    if (firstError_) return std::unexpected(*firstError_);
    return {};
  }

 private:
  // What is known of a directory that the stack is in.
  struct Level {
    size_t pathLength;  // of path_ without this directory's name and the slash before it
    int emptyings = 1;
    bool hasFailures = false;
  };

  void step() {
    const auto entry = stack_.next();
    if (!entry) {
      levels_.back().hasFailures = true;
      note(entry.error());
    }
    if (!entry || !*entry) return leave();
    const char* const name = (*entry)->name;
    const int parent = stack_.innermost();
    if (!removeItem(parent, name, (*entry)->type)) report(parent, name, path_ + '/' + name);
  }

  // Removes the item, or goes down into it. False when it resists, with the reason in error_.
  bool removeItem(int parent, const char* name, unsigned char type) {
    bool isDirectory = type == DT_DIR;
    for (int swap = 0; swap < kSwaps; ++swap) {
      const bool done = isDirectory ? enter(parent, name) : unlink(parent, name, 0);
      if (done) return true;
      const bool isOther = isDirectory ? isNoDirectory(error_) : error_ == Errno{EISDIR};
      if (!isOther) return false;
      isDirectory = !isDirectory;
    }
    return false;
  }

  bool unlink(int parent, const char* name, int flags) {
    if (::unlinkat(parent, name, flags) == 0 || errno == ENOENT) return true;
    error_ = Errno{errno};
    return false;
  }

  bool enter(int parent, const char* name) {
    auto directory = openBeneath(parent, name, kReadDirectory, Mounts::refuse);
    if (!directory) {
      error_ = directory.error();
      return error_ == Errno{ENOENT};
    }
    const size_t pathLength = path_.size();
    if (!stack_.isEmpty()) path_.append(1, '/').append(name);
    levels_.push_back({pathLength});
    const auto pushed = stack_.push(std::move(*directory));
    if (!pushed) lose(pushed.error());
    return true;
  }

  // Goes back up from a directory that should be empty now, and removes it.
  void leave() {
    const Level left = levels_.back();
    const auto popped = stack_.pop();
    if (!popped) return lose(popped.error());
    levels_.pop_back();
    const int parent = stack_.isEmpty() ? rootParent_ : stack_.innermost();
    const std::string name = stack_.isEmpty() ? rootName_ : path_.substr(left.pathLength + 1);
    const std::string path = path_;
    if (!stack_.isEmpty()) path_.resize(left.pathLength);
    if (!unlink(parent, name.c_str(), AT_REMOVEDIR) && !isHandledAgain(parent, name, left)) {
      report(parent, name, path);
    }
  }

  // Whether a directory that would not go has been dealt with after all, or entered once more.
  bool isHandledAgain(int parent, const std::string& name, const Level& left) {
    if (error_ == Errno{ENOTDIR}) return removeItem(parent, name.c_str(), DT_UNKNOWN);
    if (error_ != Errno{ENOTEMPTY} || left.hasFailures || left.emptyings == kEmptyings) {
      return false;
    }
    const size_t depth = levels_.size();
    if (!removeItem(parent, name.c_str(), DT_DIR)) return false;
    if (levels_.size() > depth) levels_.back().emptyings = left.emptyings + 1;
    return true;
  }

  // Tells of the item that resists with error_.
  void report(int parent, const std::string& name, const std::string& path) {
    const auto remaining = onFailure_ ? onFailure_(parent, name, path, error_) : error_;
    if (!remaining) return;
    if (!levels_.empty()) levels_.back().hasFailures = true;
    note(*remaining);
  }

  void note(Errno error) {
    if (!firstError_) firstError_ = error;
  }

  // The way back up is gone.
  void lose(Errno error) {
    isLost_ = true;
    note(error);
  }

  std::string path_;  // of the innermost directory
  const FileSystem::RemovalFailure& onFailure_;
  int rootParent_ = -1;
  std::string rootName_;
  DirectoryStack stack_;
  std::vector<Level> levels_;
  Errno error_;
  std::optional<Errno> firstError_;
  bool isLost_ = false;
};

}  // namespace

Result<void> FileSystem::remove(const std::string& path, const RemovalFailure& onFailure) const {
  const auto place = locate(path);
  if (!place) {
    if (place.error().value == ENOENT) return {};
    return std::unexpected(place.error());
  }
  return Removal(path, onFailure).run(place->parent.get(), place->name);
}

}  // namespace platform

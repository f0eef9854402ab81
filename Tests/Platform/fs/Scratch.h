// A fresh root for one test, and a look at it from outside.
#pragma once

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/acl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>

#include "Platform/fs/FileSystem.h"
#include "Tests/ScratchDirectory.h"

namespace platform {

class Scratch {
 public:
  explicit Scratch(Privilege privilege = ::geteuid() == 0 ? Privilege::root : Privilege::none) {
    outside_ = makeScratchDirectory(testing::TempDir());
    std::filesystem::create_directory(outside_ + "/root");
    open(privilege);
  }
  ~Scratch() {
    if (isMounted_) ::umount2(mountPoint_.c_str(), MNT_DETACH);
    // What the tests build may be too deep for the library.
    static_cast<void>(std::system(("rm -rf '" + outside_ + "'").c_str()));
  }

  FileSystem& files() { return *files_; }
  std::string path(const std::string& relative) const { return outside_ + "/root/" + relative; }
  // A path that no operation may ever reach.
  std::string outside(const std::string& relative) const { return outside_ + "/" + relative; }

  void write(const std::string& absolute, const std::string& text) const {
    std::filesystem::create_directories(std::filesystem::path(absolute).parent_path());
    std::ofstream(absolute) << text;
  }
  std::string read(const std::string& absolute) const {
    std::ifstream file(absolute);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  static struct stat look(const std::string& absolute) {
    struct stat status{};
    EXPECT_EQ(::lstat(absolute.c_str(), &status), 0) << absolute;
    return status;
  }
  static mode_t mode(const std::string& absolute) { return look(absolute).st_mode & 07777U; }

  // Mounts a file system of its own, in a mount namespace of its own. False without the right.
  bool mount(const std::string& relative) {
    mountPoint_ = path(relative);
    std::filesystem::create_directories(mountPoint_);
    isMounted_ = ::unshare(CLONE_NEWNS) == 0 &&
                 ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                 ::mount("tmpfs", mountPoint_.c_str(), "tmpfs", 0, nullptr) == 0;
    open(files_->privilege());  // the namespace's own root
    return isMounted_;
  }

 private:
  void open(Privilege privilege) {
    files_ = std::move(FileSystem::open(outside_ + "/root", privilege).value());
  }

  std::string outside_;
  std::string mountPoint_;
  bool isMounted_ = false;
  std::unique_ptr<FileSystem> files_;
};

// The short text of an ACL, as getfacl prints it.
inline std::string aclText(const std::string& path, acl_type_t type) {
  acl_t acl = ::acl_get_file(path.c_str(), type);
  if (acl == nullptr) return "none";
  char* const text = ::acl_to_text(acl, nullptr);
  std::string result = text;
  for (char& character : result) {
    if (character == '\n') character = ',';
  }
  ::acl_free(text);
  ::acl_free(acl);
  return result;
}

template <typename T>
int errorOf(const Result<T>& result) {
  return result ? 0 : result.error().value;
}

}  // namespace platform

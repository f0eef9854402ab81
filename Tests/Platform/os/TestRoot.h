// A fresh root for one test, with run/tessary prepared and etc/tessary made.
#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>

#include "Platform/fs/FileSystem.h"
#include "Platform/os/RuntimeDirectory.h"
#include "Platform/values/PropertyList.h"
#include "Tests/ScratchDirectory.h"

namespace platform {

class TestRoot {
 public:
  TestRoot() {
    path_ = makeScratchDirectory();
    const Privilege privilege = ::geteuid() == 0 ? Privilege::root : Privilege::none;
    files_ = std::move(FileSystem::open(path_, privilege).value());
    EXPECT_TRUE(prepareRuntimeDirectory(*files_));
    std::filesystem::create_directories(path_ + "/etc/tessary");
  }
  ~TestRoot() { std::filesystem::remove_all(path_); }

  FileSystem& files() { return *files_; }
  std::string path(const std::string& relative) const { return path_ + "/" + relative; }

  void write(const std::string& relative, std::string_view text) const {
    std::filesystem::create_directories(std::filesystem::path(path(relative)).parent_path());
    std::ofstream(path(relative), std::ios::binary) << text;
  }
  void writePropertyList(const std::string& relative, const Value& value) const {
    const auto bytes = writeBinaryPropertyList(value).value();
    write(relative, {reinterpret_cast<const char*>(bytes.data()), bytes.size()});
  }
  std::string read(const std::string& relative) const {
    std::ifstream file(path(relative), std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }

 private:
  std::string path_;
  std::unique_ptr<FileSystem> files_;
};

}  // namespace platform

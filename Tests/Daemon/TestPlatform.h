// A device for tests: the real services, on a fresh directory that goes with the object, with the
// users "mobile" (501) and "alice" (502). The persona service is a fake.
//
// It becomes the current platform; a test makes one and no more.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "Platform/base/Mutex.h"
#include "Platform/os/Platform.h"

inline platform::PersonaAttributes makePersona(platform::PersonaKind kind, uint32_t personaID,
                                               std::optional<std::string> uniqueString,
                                               std::vector<std::string> bundleIdentifiers = {}) {
  platform::PersonaAttributes persona;
  persona.uniqueString = std::move(uniqueString);
  persona.personaID = personaID;
  persona.kind = kind;
  persona.bundleIdentifiers = std::move(bundleIdentifiers);
  return persona;
}

// A persona service whose list changes when the test says so. Any thread.
class FakePersonas : public platform::Personas {
 public:
  using List = std::vector<platform::PersonaAttributes>;

  // Without a list the device has no personas.
  explicit FakePersonas(std::optional<List> list)
      : present_(list.has_value()), list_(std::move(list).value_or(List())) {}

  bool present() const override { return present_; }
  List list() const override {
    const platform::MutexLock lock(lock_);
    return list_;
  }
  std::optional<std::string> observe(const std::string& /*serviceName*/,
                                     std::function<void()> listDidUpdate) override {
    const platform::MutexLock lock(lock_);
    observers_.push_back(std::move(listDidUpdate));
    return std::nullopt;
  }

  // Tells nobody.
  void setList(List list) {
    const platform::MutexLock lock(lock_);
    list_ = std::move(list);
  }
  void tellObservers() {
    std::vector<std::function<void()>> observers;
    {
      const platform::MutexLock lock(lock_);
      observers = observers_;
    }
    for (const std::function<void()>& observer : observers) observer();
  }

 private:
  const bool present_;
  mutable platform::Mutex lock_;
  List list_ GUARDED_BY(lock_);
  std::vector<std::function<void()>> observers_ GUARDED_BY(lock_);
};

class TestPlatform {
 public:
  // `files` are written before the services start: paths below the root and their contents.
  explicit TestPlatform(std::optional<FakePersonas::List> personas = std::nullopt,
                        const std::map<std::string, std::string>& files = {})
      : personas_(std::move(personas)) {
    write("/etc/passwd",
          "root:x:0:0::/private/var/root:/bin/sh\n"
          "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
          "alice:x:502:502::/private/var/alice:/bin/sh\n");
    write("/etc/group", "systemusers:x:701:\n");
    for (const auto& [path, content] : files) write(path, content);
    makeHome("/private/var/root", 0);
    makeHome("/private/var/mobile", 501);
    makeHome("/private/var/alice", 502);
    auto device = platform::DevicePlatform::open(root_);
    if (!device) throw std::runtime_error("no device: " + device.error().message());
    device_ = std::move(*device);
    const platform::Platform& real = device_->platform();
    current_.reset(new platform::Platform{
        real.files, real.accounts, real.containerLayout, real.device, real.keepAlive, real.keyBag,
        real.semaphores, real.notifications, personas_, real.runLoop, real.sandbox,
        real.serviceManager, real.systemLog, real.systemVersion, real.tasks});
    platform::Platform::setCurrent(*current_);
  }
  ~TestPlatform() {
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }
  TestPlatform(const TestPlatform&) = delete;
  TestPlatform& operator=(const TestPlatform&) = delete;

  FakePersonas& personas() { return personas_; }
  // A path of the device as the outside sees it.
  std::string path(const std::string& devicePath) const { return root_ + devicePath; }
  void write(const std::string& devicePath, const std::string& content) const {
    const std::filesystem::path file = path(devicePath);
    std::filesystem::create_directories(file.parent_path());
    std::ofstream(file) << content;
  }

 private:
  static std::string makeRoot() {
    std::string root = std::filesystem::canonical(testing::TempDir()).string() + "/tessary.XXXXXX";
    if (::mkdtemp(root.data()) == nullptr) throw std::runtime_error("no scratch directory");
    return root;
  }
  void makeHome(const std::string& devicePath, uid_t owner) const {
    std::filesystem::create_directories(path(devicePath));
    // Without root's rights everything belongs to the tester, which is as good.
    if (::geteuid() == 0 && ::chown(path(devicePath).c_str(), owner, owner) != 0) {
      throw std::runtime_error("no home");
    }
  }

  const std::string root_ = makeRoot();
  FakePersonas personas_;
  std::unique_ptr<platform::DevicePlatform> device_;
  std::unique_ptr<platform::Platform> current_;
};

#include "Tests/Integration/ContainerState.h"

#include <fmt/format.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "Platform/values/PropertyList.h"
#include "Platform/values/UUID.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/ScratchDirectory.h"

using platform::UUID;
using platform::Value;

namespace {

constexpr char kMetadataFile[] = "/.com.veltra.tessary.metadata.plist";
constexpr char kUserContainers[] = "/private/var/mobile/Containers";
constexpr char kGlobalContainers[] = "/private/var/containers";
constexpr char kCaches[] = "/private/var/root/Library/Caches/com.veltra.tessaryd";

std::string attribute(const std::string& path, const char* name) {
  std::array<unsigned char, 256> value{};
  const ssize_t length = ::lgetxattr(path.c_str(), name, value.data(), value.size());
  std::string text;
  for (ssize_t i = 0; i < length; ++i) text += fmt::format("{:02x}", value[static_cast<size_t>(i)]);
  return text;
}

std::string lookOf(const std::string& path) {
  struct stat status{};
  if (::lstat(path.c_str(), &status) != 0) return "missing";
  return fmt::format("{:o} {}:{} class {} access {} default {}", status.st_mode, status.st_uid,
                     status.st_gid, attribute(path, "trusted.tessary.protection-class"),
                     attribute(path, "system.posix_acl_access"),
                     attribute(path, "system.posix_acl_default"));
}

std::string metadataDefect(const Creation& creation, const std::string& file) {
  std::ifstream stream(file, std::ios::binary);
  const std::vector<uint8_t> bytes{std::istreambuf_iterator<char>(stream), {}};
  const auto value = platform::readPropertyList(bytes);
  if (!value || value->asDictionary() == nullptr) return "no property list: " + file;
  Value::Dictionary entries = *value->asDictionary();
  const auto text = [&](const char* key) { return entries[key].description(); };
  if (text("TSYMetadataIdentifier") != Value(creation.identifier).description() ||
      text("TSYMetadataContentClass") != Value(creation.containerClass).description() ||
      !UUID::parse(text("TSYMetadataUUID"))) {
    return "not its own metadata: " + value->description();
  }
  return {};
}

}  // namespace

std::string Creation::classDirectory() const {
  const std::string base = containerClass < 12 ? kUserContainers : kGlobalContainers;
  const char* const name = containerClass == 2    ? "/Data/Application"
                           : containerClass == 12 ? "/Data/System"
                                                  : "/Shared/SystemGroup";
  return base + (transient ? "/Temp" : "") + name;
}

std::string Creation::stagingDirectory() const {
  return std::string(containerClass < 12 ? kUserContainers : kCaches) + "/Staging";
}

tessary::Result<tessary::Container> Creation::request(tessary::Client& client) const {
  return client.createOrLookup(identifier, containerClass,
                               {.createIfNecessary = true, .transient = transient});
}

tessary::Result<tessary::Container> Creation::lookUp(tessary::Client& client) const {
  return client.createOrLookup(identifier, containerClass);
}

std::string quickParent() {
  if (::access("/dev/shm", W_OK) != 0) return {};
  const std::string probe = makeScratchDirectory("/dev/shm");
  const bool isFit =
      ::setxattr(probe.c_str(), "trusted.tessary.probe", "", 0, 0) == 0 &&
      (::getxattr(probe.c_str(), "system.posix_acl_default", nullptr, 0) >= 0 || errno == ENODATA);
  std::filesystem::remove(probe);
  return isFit ? "/dev/shm" : std::string();
}

std::vector<std::string> itemsIn(const Device& device, const std::string& directory) {
  std::vector<std::string> names;
  std::error_code missing;
  for (const auto& item : std::filesystem::directory_iterator(device.path(directory), missing)) {
    names.push_back(item.path().filename());
  }
  return names;
}

Picture pictureOf(const std::string& container) {
  Picture picture{{"", lookOf(container)}};
  std::error_code missing;
  for (const auto& item : std::filesystem::recursive_directory_iterator(container, missing)) {
    const std::string path = item.path();
    picture.emplace(path.substr(container.size()), lookOf(path));
  }
  return picture;
}

std::string defectOf(const Creation& creation, const std::string& path, const Picture& model) {
  Picture picture = pictureOf(path);
  for (const auto& [name, look] : model) {
    const std::string found = picture.contains(name) ? picture.at(name) : "missing";
    if (found != look) return fmt::format("{}: {} is {} and should be {}", path, name, found, look);
    picture.erase(name);
  }
  if (!picture.empty()) return path + ": too much in it: " + picture.begin()->first;
  return metadataDefect(creation, path + kMetadataFile);
}

void startAndCleanUp(Device& device) {
  const std::string counter =
      device.path("/run/tessary/notifications/com.veltra.tessary.cleanup-complete");
  std::filesystem::remove(counter);
  device.start();
  becomes([&] { return std::filesystem::exists(counter); });
}

std::string litterThatStays(const Device& device, const Creation& creation,
                            const std::string& passedOver) {
  std::string litter;
  becomes([&] {
    litter.clear();
    for (const std::string& name : itemsIn(device, kDeathRow)) litter += " on death row: " + name;
    for (const std::string& name : itemsIn(device, creation.stagingDirectory())) {
      if (!name.starts_with(passedOver)) litter += " in staging: " + name;
    }
    return litter.empty();
  });
  return litter;
}

#include "Platform/os/ContainerLayout.h"

#include <set>

#include "Platform/base/WholeNumber.h"
#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/PlatformLog.h"
#include "Platform/os/RuntimeDirectory.h"

namespace platform {
namespace {

using Layout = std::expected<std::vector<std::string>, uint64_t>;

std::map<uint64_t, Layout> ownTable() {
  const Layout bundle;
  const Layout group{{"Library", "Library/Caches", "Library/Preferences"}};
  const Layout service{{"Library", "Library/Caches", "Library/Preferences", "tmp"}};
  const Layout plugin{{"Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}};
  const Layout application{
      {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}};
  return {
      {1, bundle},   {2, application}, {3, bundle}, {4, plugin},  {5, bundle},
      {6, service},  {7, group},       {8, bundle}, {9, service}, {10, service},
      {11, service}, {12, service},    {13, group},
  };
}

// In order, a path comes after what it begins with: parents, which are added where they are not
// listed, stand before their children.
Layout layoutFromValue(const Value& value) {
  if (value.asArray() == nullptr) return std::unexpected(ContainerLayout::kUnknownClass);
  std::set<std::string> paths;
  for (const Value& item : *value.asArray()) {
    const std::string* path = item.asString();
    if (path == nullptr || !isPathOfNames(*path)) {
      return std::unexpected(ContainerLayout::kUnknownClass);
    }
    for (size_t slash = path->find('/'); slash != std::string::npos;
         slash = path->find('/', slash + 1)) {
      paths.insert(path->substr(0, slash));
    }
    paths.insert(*path);
  }
  return std::vector<std::string>(paths.begin(), paths.end());
}

}  // namespace

ContainerLayout::ContainerLayout(const FileSystem& files) : layouts_(ownTable()) {
  const std::string path = configurationDirectory(files) + "/container-layout.plist";
  for (const auto& [key, value] : readConfigurationDictionary(files, path)) {
    const auto containerClass = wholeNumber<uint64_t>(key);
    const Layout layout = layoutFromValue(value);
    if (!containerClass || !layout) {
      platformLog(LogLevel::error, "ContainerLayout::ContainerLayout",
                  "{}: \"{}\" is not a class number with an array of relative paths: {}", path, key,
                  value.description());
    }
    if (containerClass) layouts_.insert_or_assign(*containerClass, layout);
  }
}

std::expected<std::vector<std::string>, uint64_t> ContainerLayout::subdirectoriesOfClass(
    uint64_t containerClass) const {
  const auto found = layouts_.find(containerClass);
  if (found == layouts_.end()) return std::unexpected(kUnknownClass);
  return found->second;
}

}  // namespace platform

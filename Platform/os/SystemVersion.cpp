#include "Platform/os/SystemVersion.h"

#include <map>
#include <string_view>

#include "Platform/os/OpenFile.h"
#include "Platform/os/PlatformLog.h"

namespace platform {
namespace {

using Assignments = std::map<std::string, std::string, std::less<>>;

// The value of a shell-compatible assignment: bare, or in quotes with backslashes before what would
// otherwise mean something.
std::string unquoted(std::string_view text) {
  char quote = 0;
  if (text.size() >= 2 && (text.front() == '"' || text.front() == '\'') &&
      text.back() == text.front()) {
    quote = text.front();
    text = text.substr(1, text.size() - 2);
  }
  std::string value;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\\' && quote != '\'' && i + 1 < text.size()) ++i;
    value += text[i];
  }
  return value;
}

Assignments parse(std::string_view text) {
  Assignments assignments;
  while (!text.empty()) {
    const size_t length = std::min(text.find('\n'), text.size());
    std::string_view line = text.substr(0, length);
    text.remove_prefix(std::min(length + 1, text.size()));
    while (!line.empty() && (line.back() == ' ' || line.back() == '\r')) line.remove_suffix(1);
    const size_t equals = line.find('=');
    if (line.starts_with('#') || equals == std::string_view::npos) continue;
    assignments.insert_or_assign(std::string(line.substr(0, equals)),
                                 unquoted(line.substr(equals + 1)));
  }
  return assignments;
}

// Distributions have a link in etc that leads to usr/lib; the link itself is not followed.
Assignments readOSRelease(const FileSystem& files) {
  constexpr size_t kLongestFile = 1024 * 1024;
  auto bytes = files.readFile(files.root() + "/etc/os-release", kLongestFile);
  if (!bytes) bytes = files.readFile(files.root() + "/usr/lib/os-release", kLongestFile);
  if (bytes) return parse(asText(*bytes));
  platformLog(LogLevel::info, "SystemVersion::SystemVersion", "no os-release: {}",
              bytes.error().message());
  return {};
}

}  // namespace

SystemVersion::SystemVersion(const FileSystem& files) {
  const Assignments release = readOSRelease(files);
  const auto take = [&](std::string_view name, const char* key) {
    const auto found = release.find(name);
    if (found != release.end()) dictionary_[key] = found->second;
  };
  take("NAME", "ProductName");
  take("VERSION_ID", "ProductVersion");
  take("VERSION_ID", "ProductBuildVersion");
  take("BUILD_ID", "ProductBuildVersion");
  take("VARIANT_ID", "ReleaseType");
  const auto variant = release.find("VARIANT_ID");
  internal_ = variant != release.end() && variant->second == "internal";
}

}  // namespace platform

#include "Platform/os/ConfigurationFile.h"

#include <fmt/format.h>

#include <algorithm>

#include "Platform/base/WholeNumber.h"
#include "Platform/os/OpenFile.h"
#include "Platform/os/PlatformLog.h"
#include "Platform/values/PropertyList.h"

namespace platform {
namespace {

constexpr size_t kLongestFile = 16 * 1024 * 1024;
constexpr size_t kLongestNumber = 64;

Result<std::vector<uint8_t>> readOrLog(const FileSystem& files, const std::string& path,
                                       size_t limit) {
  auto bytes = files.readFile(path, limit);
  if (!bytes && bytes.error().value != ENOENT) {
    platformLog(LogLevel::error, "ConfigurationFile::read", "{} cannot be read: {}", path,
                bytes.error().message());
  }
  return bytes;
}

std::unexpected<Errno> malformed(const std::string& path, std::string_view reason) {
  platformLog(LogLevel::error, "ConfigurationFile::read", "{} is malformed: {}", path, reason);
  return failWith(EINVAL);
}

}  // namespace

Result<Value> readConfigurationFile(const FileSystem& files, const std::string& path) {
  const auto bytes = readOrLog(files, path, kLongestFile);
  if (!bytes) return std::unexpected(bytes.error());
  auto value = readPropertyList(*bytes);
  if (!value) return malformed(path, value.error().reason);
  return *std::move(value);
}

Value::Dictionary readConfigurationDictionary(const FileSystem& files, const std::string& path) {
  auto value = readConfigurationFile(files, path);
  if (!value) return {};
  if (value->asDictionary() != nullptr) return std::move(*value->asDictionary());
  (void)malformed(path, fmt::format("no dictionary: {}", value->typeName()));
  return {};
}

Result<uint64_t> readNumberFile(const FileSystem& files, const std::string& path) {
  const auto bytes = readOrLog(files, path, kLongestNumber);
  if (!bytes) return std::unexpected(bytes.error());
  std::string_view text = asText(*bytes);
  if (text.ends_with('\n')) text.remove_suffix(1);
  const auto number = wholeNumber<uint64_t>(text);
  if (!number) return malformed(path, "not one decimal number");
  return *number;
}

Result<void> writeNumberFile(const FileSystem& files, const std::string& path, uint64_t number) {
  const std::string text = fmt::format("{}\n", number);
  return files.writeFile(path, asBytes(text), {.atomic = true});
}

bool isPathOfNames(std::string_view path) {
  if (path.find('\0') != std::string_view::npos) return false;
  for (;;) {
    const size_t length = std::min(path.find('/'), path.size());
    const std::string_view component = path.substr(0, length);
    if (component.empty() || component == "." || component == "..") return false;
    if (length == path.size()) return true;
    path.remove_prefix(length + 1);
  }
}

}  // namespace platform

#include "Platform/os/ConfigurationFile.h"

#include <fmt/format.h>

#include <charconv>

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
  static_cast<void>(malformed(path, fmt::format("no dictionary: {}", value->typeName())));
  return {};
}

Result<uint64_t> readNumberFile(const FileSystem& files, const std::string& path) {
  const auto bytes = readOrLog(files, path, kLongestNumber);
  if (!bytes) return std::unexpected(bytes.error());
  std::string_view text = asText(*bytes);
  if (text.ends_with('\n')) text.remove_suffix(1);
  uint64_t number = 0;
  const auto parsed = std::from_chars(text.data(), text.data() + text.size(), number);
  if (parsed.ec != std::errc() || parsed.ptr != text.data() + text.size()) {
    return malformed(path, "not one decimal number");
  }
  return number;
}

Result<void> writeNumberFile(const FileSystem& files, const std::string& path, uint64_t number) {
  const std::string text = fmt::format("{}\n", number);
  return files.writeFile(path, {reinterpret_cast<const uint8_t*>(text.data()), text.size()},
                         {.mode = 0644, .protectionClass = {}, .atomic = true});
}

}  // namespace platform

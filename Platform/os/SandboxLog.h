// The text form of container path mappings, as they stand in run/tessary/sandbox/mappings:
//
//   set <tab> uid <tab> persona id <tab> item type <tab> identifier <tab> path
//   clear <tab> uid <tab> persona id <tab> item type <tab> identifier
//
// Identifier and path are percent-encoded: space, "%", control characters. So neither tab nor line
// feed can stand in a field. Any thread.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "Platform/base/Errno.h"
#include "Platform/fs/FileSystem.h"

namespace platform {

struct SandboxMappingKey;

// A line that is longer is malformed, and never written.
inline constexpr size_t kLongestMappingLine = 64 * 1024;

struct SandboxMapping {
  uid_t uid = 0;
  int32_t personaID = 0;
  uint32_t itemType = 0;
  std::string identifier;
  std::optional<std::string> path;  // none: the mapping was cleared
};

std::string sandboxLogPath(const FileSystem& files);

// Whether the line would not be too long.
bool fitsMappingLine(const SandboxMappingKey& key, const std::optional<std::string>& path);
// With the line feed.
std::string formatMappingLine(const SandboxMappingKey& key, const std::optional<std::string>& path);
// Without the line feed.
std::optional<SandboxMapping> parseMappingLine(std::string_view line);

// Calls `visit` for every whole line of the file, without its line feed. What is too long, and an
// unfinished line at the end, comes as an empty one.
Result<void> forEachLine(int descriptor, const std::function<void(std::string_view)>& visit);

}  // namespace platform

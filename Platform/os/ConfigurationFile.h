// The small files that configure the stand-ins or hold their state. A missing one means the
// default; a malformed one leaves a line in the system log and means the default too. Any thread.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "Platform/fs/FileSystem.h"
#include "Platform/values/Value.h"

namespace platform {

// A property list of any type. ENOENT without a file; every other failure is logged here, and
// EINVAL stands for malformed content.
Result<Value> readConfigurationFile(const FileSystem& files, const std::string& path);
// The dictionary in a file: empty when it is missing or malformed.
Value::Dictionary readConfigurationDictionary(const FileSystem& files, const std::string& path);

// A file of one decimal number, with failures as above.
Result<uint64_t> readNumberFile(const FileSystem& files, const std::string& path);
// Replaces it atomically.
Result<void> writeNumberFile(const FileSystem& files, const std::string& path, uint64_t number);

// Whether a relative path that such a file holds stays below where it starts: every component is a
// name, none of them empty, "." or "..", and no NUL is in it.
bool isPathOfNames(std::string_view path);

}  // namespace platform

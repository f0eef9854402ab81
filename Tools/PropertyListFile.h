// Property lists in files of the caller's, anywhere, for the options of the tools. Such a file may
// be a pipe.
#pragma once

#include <fcntl.h>

#include <expected>
#include <string>

#include "Platform/base/FileDescriptor.h"
#include "Platform/os/OpenFile.h"
#include "Platform/values/PropertyList.h"

// Fails with what is wrong with the file.
inline std::expected<platform::Value, std::string> readPropertyListFile(const std::string& path) {
  const platform::FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!file.valid()) return std::unexpected(platform::Errno{errno}.message());
  const auto bytes = platform::readToEnd(file.get(), platform::PropertyListLimits::kBytes);
  if (!bytes) return std::unexpected(bytes.error().message());
  auto value = platform::readPropertyList(*bytes);
  if (!value) return std::unexpected(std::move(value.error().reason));
  return *std::move(value);
}

// One that must hold a dictionary.
inline std::expected<platform::Value::Dictionary, std::string> readDictionaryFile(
    const std::string& path) {
  auto value = readPropertyListFile(path);
  if (!value) return std::unexpected(std::move(value.error()));
  if (value->asDictionary() == nullptr) {
    return std::unexpected("no dictionary: " + std::string(value->typeName()));
  }
  return std::move(*value->asDictionary());
}

// The bare system calls that the benchmarks compare with: no look at what is there, no care for
// links. A failure ends the benchmark.
#pragma once

#include <sys/types.h>

#include <string>

#include "Platform/values/Value.h"

inline constexpr uid_t kUser = 501;
inline constexpr char kMetadataFile[] = ".com.veltra.tessary.metadata.plist";

void check(bool succeeded, const char* failure);

// A metadata file of an application's data container.
platform::Value::Data metadata(const std::string& identifier);
void writeSynced(const std::string& path, const platform::Value::Data& bytes);
void makeOwnedDirectory(const std::string& path);
void rename(const std::string& from, const std::string& to);
void syncDirectory(const std::string& path);

// How the configuration objects make their directories. Any thread.
#pragma once

#include <source_location>
#include <string_view>

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYURL.h"

struct TSYConfigurationDirectory {
  // What the directory is called when it cannot be made, such as "cache dir".
  std::string_view kind;
  uid_t owner = TSYFileManager::kUnchangedOwner;
  int protectionClass = TSYFileManager::kUnchangedProtectionClass;
};

// Makes the directory, 0755, and what is missing above it. A failure is logged, for the operation
// at `where`, and nothing more: whoever uses the directory fails with an error of its own.
void TSYMakeConfigurationDirectory(const TSYURL& url, const TSYConfigurationDirectory& directory,
                                   std::source_location where = std::source_location::current());

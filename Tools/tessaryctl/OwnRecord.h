// The record that tessaryctl writes for itself, so that the daemon knows who asks.
#pragma once

#include <optional>
#include <string>

struct OwnRecordOptions {
  std::string root;
  std::optional<std::string> identifier;
  std::optional<std::string> entitlementsFile;
  bool sandboxed = false;
  std::optional<std::string> persona;
};

// A process that was started with a record keeps it; one without gets one, when it has the rights
// to write it: the identifier "com.veltra.tessaryctl" and every entitlement of the command table,
// unless the options choose others. Returns what is wrong, or nothing.
std::optional<std::string> writeOwnRecord(const OwnRecordOptions& options);

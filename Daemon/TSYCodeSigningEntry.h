// What the daemon remembers of one code-signing identifier: an application, a plug-in or a
// placeholder.
//
// A plain value; the mapping shares it as TSYCodeSigningEntryRef once it has been read.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Platform/values/Value.h"

struct TSYCodeSigningEntry {
  using Info = std::shared_ptr<const platform::Value::Dictionary>;

  TSYCodeSigningEntry() = default;
  explicit TSYCodeSigningEntry(Info info, uint64_t containerClass = 0);
  // Reads the serialized form. What is missing or of another type is null, false or 0.
  static TSYCodeSigningEntry fromSerializedDictionary(
      const platform::Value::Dictionary& serialized);
  platform::Value::Dictionary serialize() const;

  // Kept, but no longer to be trusted.
  bool invalid = false;
  // Registered for an application whose bundle is not there yet.
  bool placeholder = false;
  // Registered ahead of the installation; goes at the next boot.
  bool advanceCopy = false;
  // Registered by a client's own request, not by the installer.
  bool registeredByCaller = false;
  // Whatever the installer says of the identifier, its entitlements above all. May be null.
  Info codeSigningInfo;
  // The plug-ins that belong to the identifier; none is not the same as an empty list.
  std::optional<std::vector<std::string>> childBundleIdentifiers;
  // The class of the identifier's data container; 0 when none is recorded.
  uint64_t dataContainerClass = 0;

  bool operator==(const TSYCodeSigningEntry& other) const;
  size_t hash() const;
  std::string description() const;
};

using TSYCodeSigningEntryRef = std::shared_ptr<const TSYCodeSigningEntry>;

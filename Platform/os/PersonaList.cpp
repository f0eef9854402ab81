#include "Platform/os/PersonaList.h"

#include <fmt/format.h>

#include <array>
#include <limits>
#include <optional>
#include <set>

#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/RuntimeDirectory.h"

namespace platform {
namespace {

// In the order of PersonaKind.
constexpr std::array<std::string_view, 4> kKindNames{"personal", "enterprise", "universal",
                                                     "system"};

using Failure = std::optional<std::string>;

Failure wrong(const char* key, const Value* value) {
  return fmt::format("\"{}\" cannot be {}", key,
                     value == nullptr ? "missing" : value->description());
}

Failure readUniqueString(const Value& entry, PersonaAttributes& persona) {
  const Value* value = entry.find(persona_key::kUniqueString);
  if (value == nullptr) return std::nullopt;
  const std::string* text = value->asString();
  if (text == nullptr || text->empty()) return wrong(persona_key::kUniqueString, value);
  persona.uniqueString = *text;
  return std::nullopt;
}

// The kernel's persona ids are signed.
Failure readPersonaID(const Value& entry, PersonaAttributes& persona) {
  const Value* value = entry.find(persona_key::kPersonaID);
  const auto number = value == nullptr ? std::nullopt : value->asUInt64();
  if (!number || *number > std::numeric_limits<int32_t>::max()) {
    return wrong(persona_key::kPersonaID, value);
  }
  persona.personaID = static_cast<uint32_t>(*number);
  return std::nullopt;
}

Failure readKind(const Value& entry, PersonaAttributes& persona) {
  const Value* value = entry.find(persona_key::kKind);
  const std::string* text = value == nullptr ? nullptr : value->asString();
  for (size_t i = 0; text != nullptr && i < kKindNames.size(); ++i) {
    if (kKindNames[i] != *text) continue;
    persona.kind = static_cast<PersonaKind>(i);
    return std::nullopt;
  }
  return wrong(persona_key::kKind, value);
}

bool isCleanAbsolutePath(std::string_view path) {
  return path.starts_with('/') && isPathOfNames(path.substr(1));
}

Failure readLayoutPath(const Value& entry, const std::string& root, PersonaAttributes& persona) {
  const Value* value = entry.find(persona_key::kLayoutPath);
  if (value == nullptr) return std::nullopt;
  const std::string* path = value->asString();
  if (path == nullptr || !isCleanAbsolutePath(*path)) return wrong(persona_key::kLayoutPath, value);
  persona.layoutPath = root + *path;
  return std::nullopt;
}

Failure readBundleIdentifiers(const Value& entry, PersonaAttributes& persona) {
  const Value* value = entry.find(persona_key::kBundleIdentifiers);
  if (value == nullptr) return std::nullopt;
  if (value->asArray() == nullptr) return wrong(persona_key::kBundleIdentifiers, value);
  for (const Value& identifier : *value->asArray()) {
    if (identifier.asString() == nullptr) return wrong(persona_key::kBundleIdentifiers, value);
    persona.bundleIdentifiers.push_back(*identifier.asString());
  }
  return std::nullopt;
}

Failure readPersona(const Value& entry, const std::string& root, PersonaAttributes& persona) {
  if (entry.asDictionary() == nullptr) return "it is no dictionary";
  if (auto failure = readUniqueString(entry, persona)) return failure;
  if (auto failure = readPersonaID(entry, persona)) return failure;
  if (auto failure = readKind(entry, persona)) return failure;
  if (auto failure = readLayoutPath(entry, root, persona)) return failure;
  return readBundleIdentifiers(entry, persona);
}

}  // namespace

std::string personaListPath(const FileSystem& files) {
  return configurationDirectory(files) + "/personas.plist";
}

std::string_view personaKindName(PersonaKind kind) {
  return kKindNames[static_cast<size_t>(kind)];
}

std::expected<std::vector<PersonaAttributes>, std::string> parsePersonaList(
    const Value& list, const std::string& root) {
  if (list.asArray() == nullptr) return std::unexpected("it is no array");
  std::vector<PersonaAttributes> personas;
  std::set<std::string> uniqueStrings;
  std::set<uint32_t> personaIDs;
  for (const Value& entry : *list.asArray()) {
    PersonaAttributes persona;
    auto failure = readPersona(entry, root, persona);
    const auto& uniqueString = persona.uniqueString;
    if (!failure && uniqueString && !uniqueStrings.insert(*uniqueString).second) {
      failure = fmt::format("unique string \"{}\" is another's", *uniqueString);
    }
    if (!failure && !personaIDs.insert(persona.personaID).second) {
      failure = fmt::format("persona id {} is another's", persona.personaID);
    }
    if (failure) return std::unexpected(fmt::format("persona {}: {}", personas.size(), *failure));
    personas.push_back(std::move(persona));
  }
  return personas;
}

std::string PersonaAttributes::description() const {
  return fmt::format(
      "{{kind = {}; persona id = {}; unique string = {}; layout path = {}; "
      "bundle identifiers = ({})}}",
      personaKindName(kind), personaID, uniqueString.value_or("none"), layoutPath.value_or("none"),
      fmt::join(bundleIdentifiers, ", "));
}

}  // namespace platform

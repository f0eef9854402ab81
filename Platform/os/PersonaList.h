// The content of etc/tessary/personas.plist: an array of dictionaries with "UniqueString",
// "PersonaID", "Kind", "LayoutPath" and "BundleIdentifiers".
//
// A list is good as a whole or not at all: an entry that is passed over could be the one that keeps
// an application out of another persona's data. Any thread.
#pragma once

#include <expected>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/fs/FileSystem.h"
#include "Platform/os/Personas.h"
#include "Platform/values/Value.h"

namespace platform {

namespace persona_key {
inline constexpr char kUniqueString[] = "UniqueString";
inline constexpr char kPersonaID[] = "PersonaID";
inline constexpr char kKind[] = "Kind";
inline constexpr char kLayoutPath[] = "LayoutPath";
inline constexpr char kBundleIdentifiers[] = "BundleIdentifiers";
}  // namespace persona_key

std::string personaListPath(const FileSystem& files);

std::string_view personaKindName(PersonaKind kind);

// The list, with `root` in front of layout paths; else what is wrong with it.
std::expected<std::vector<PersonaAttributes>, std::string> parsePersonaList(
    const Value& list, const std::string& root);

}  // namespace platform

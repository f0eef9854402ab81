// Names that nobody can have put in the way beforehand.
#pragma once

#include <string>

#include "Platform/base/Errno.h"

namespace platform {

// `prefix` and `characters` random letters and digits.
Result<std::string> randomName(std::string prefix, size_t characters);

// The name of something that will be renamed into place: dot-named, so that listings hide it.
inline constexpr char kTemporaryPrefix[] = ".tmp.";
Result<std::string> temporarySiblingName();

// How often a name that turns out to be taken is drawn anew before EEXIST is answered.
inline constexpr int kNameAttempts = 32;

}  // namespace platform

// The property-list files of the daemon, and the string functions that paths need.
//
// All functions may be called from any thread.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "Daemon/TSYError.h"
#include "Daemon/TSYURL.h"
#include "Platform/values/Value.h"

// How TSY_writeToURL writes, or-ed together.
inline constexpr uint32_t kTSYWriteAtomic = 1;
// Protection class none: the file can be read while the device is locked.
inline constexpr uint32_t kTSYWriteProtectionNone = 0x10000000;

// Writes a dictionary as a binary property list of mode 0644, on disk when the call returns. Fails
// with the error of the serialisation or of the write.
TSYResult<void> TSY_writeToURL(const platform::Value::Dictionary& dictionary, const TSYURL& url,
                               uint32_t options);

// Reads a file of at most 16 MiB that holds a dictionary, in any property-list format.
TSYResult<platform::Value::Dictionary> TSY_dictionaryWithContentsOfURL(const TSYURL& url);

// The value under a key; null when there is none.
const platform::Value* TSYValueUnder(const platform::Value::Dictionary& dictionary,
                                     std::string_view key);
// Whether a number that is true is there.
bool TSYFlagUnder(const platform::Value::Dictionary& dictionary, std::string_view key);

// Whether a value from outside can be stored at all: the reason why not is logged.
bool TSYHasPropertyListForm(const platform::Value& value);

// Whether a component of the path, split on "/", equals "..".
bool containsDotDotPathComponents(std::string_view path);

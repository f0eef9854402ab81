// The binary form of a property list, shared by its reader and its writer.
//
// A file is the header, then the objects, then the offset table (where each object lies), then the
// trailer. All numbers are big-endian. An object is a marker byte and what its kind needs; the high
// half of the marker is the kind, the low half its size. Containers name their elements by number
// in the offset table. Sizes from 15 on follow the marker as an integer object.
#pragma once

#include <cstdint>
#include <string_view>

namespace platform::binary_property_list {

constexpr std::string_view kHeader = "bplist00";
// The part of the header that every version has.
constexpr std::string_view kMagic = "bplist";

// Whole markers.
constexpr uint8_t kNull = 0x00;
constexpr uint8_t kFalse = 0x08;
constexpr uint8_t kTrue = 0x09;
constexpr uint8_t kReal32 = 0x22;
constexpr uint8_t kReal64 = 0x23;
constexpr uint8_t kDate = 0x33;

// Kinds: the high half of a marker.
constexpr uint8_t kInteger = 0x10;     // low half: the logarithm of the width
constexpr uint8_t kReal = 0x20;        // likewise
constexpr uint8_t kData = 0x40;        // low half: the number of bytes
constexpr uint8_t kASCII = 0x50;       // of characters
constexpr uint8_t kUTF16 = 0x60;       // of 16-bit units
constexpr uint8_t kUID = 0x80;         // the width less one
constexpr uint8_t kArray = 0xA0;       // of elements
constexpr uint8_t kSet = 0xC0;         // of elements
constexpr uint8_t kDictionary = 0xD0;  // of pairs: first all keys, then all values

constexpr uint8_t kKindMask = 0xF0;
constexpr uint8_t kSizeMask = 0x0F;
// The low half of a marker whose size follows as an integer object.
constexpr uint8_t kSizeFollows = 0x0F;

// The trailer: unused bytes, the width of an offset and of a reference (a byte each), then the
// number of objects, the root's number and the place of the offset table (8 bytes each).
constexpr size_t kTrailerSize = 32;
constexpr size_t kTrailerUnused = 6;

// Dates count from 2001-01-01 00:00:00 UTC.
constexpr double kEpochSince1970 = 978307200;
// The farthest date, in seconds: beyond it a double cannot move between the two epochs without
// loss.
constexpr double kFarthestDate = 4503599627370496;  // 2^52

}  // namespace platform::binary_property_list

// The scalars of the XML form, from the text of their elements. White space around any of them is
// passed over; nothing is returned for what is no such scalar.
#pragma once

#include <optional>
#include <string_view>

#include "Platform/values/Value.h"

namespace platform::xml_property_list {

// The white space of XML.
constexpr std::string_view kSpace = " \t\r\n";

// Decimal or, after 0x, hexadecimal, with a sign or without; from the least int64_t to the largest
// uint64_t.
std::optional<Value> parseInteger(std::string_view text);
// Decimal with or without an exponent, "nan", or "inf" and "infinity", in either case.
std::optional<double> parseReal(std::string_view text);
// YYYY-MM-DDTHH:MM:SSZ
std::optional<Date> parseDate(std::string_view text);
// Base64, padded, with white space anywhere.
std::optional<Value::Data> parseData(std::string_view text);

}  // namespace platform::xml_property_list

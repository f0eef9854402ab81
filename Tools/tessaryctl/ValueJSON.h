// Info values as JSON text. JSON knows neither data nor dates: they are shown as {"data": base64}
// and {"date": seconds since 1970}, and given in the same form.
#pragma once

#include <expected>
#include <string>

#include "Platform/values/Value.h"

// Fails with what is wrong with the text.
std::expected<platform::Value, std::string> valueOfJSON(const std::string& text);
std::string jsonOfValue(const platform::Value& value);

// The name of a type for people, such as "std::runtime_error".
#pragma once

#include <string>
#include <typeinfo>

std::string TSYTypeName(const std::type_info& type);

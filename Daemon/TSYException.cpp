#include "Daemon/TSYException.h"

#include <exception>

#include "Daemon/TSYTypeName.h"

TSYError TSYErrorFromCurrentException(std::source_location where) {
  std::string name = "unknown";
  std::string reason = "(no reason)";
  try {
    throw;
  } catch (const std::exception& exception) {
    name = TSYTypeName(typeid(exception));
    reason = exception.what();
  } catch (...) {
    reason = "not a standard exception";
  }
  return TSYErrorCreateWithText(TSYErrorException, std::nullopt, TSYLogIt::yes, where,
                                fmt::format("Got exception: {} : {}", name, reason));
}

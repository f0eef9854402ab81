#include "Daemon/TSYException.h"

TSYError TSYErrorFromException(const std::exception& exception, std::source_location where) {
  return TSYErrorCreateWithText(
      TSYErrorException, std::nullopt, TSYLogIt::yes, where,
      fmt::format("Got exception: {} : {}", typeid(exception).name(), exception.what()));
}

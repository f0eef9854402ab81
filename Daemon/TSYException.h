// The boundary of an operation that is said to survive exceptions.
#pragma once

#include <source_location>
#include <utility>

#include "Daemon/TSYError.h"

// "name : reason" of the exception that is being handled becomes a failure of code 40, logged.
TSYError TSYErrorFromCurrentException(std::source_location where);

// Runs `operation`, which returns a TSYResult; an exception that escapes it becomes code 40.
template <typename Operation>
auto TSYCatchingExceptions(Operation&& operation,
                           std::source_location where = std::source_location::current())
    -> decltype(operation()) {
  try {
    return std::forward<Operation>(operation)();
  } catch (...) {
    return TSYFailure(TSYErrorFromCurrentException(where));
  }
}

// The same, unless it runs on an internal build: there an exception ends the process, with its
// report, where it was thrown.
template <typename Operation>
auto TSYCatchingExceptionsUnlessInternal(
    bool isInternalImage, Operation&& operation,
    std::source_location where = std::source_location::current()) -> decltype(operation()) {
  if (isInternalImage) return [&]() noexcept { return operation(); }();
  return TSYCatchingExceptions(std::forward<Operation>(operation), where);
}

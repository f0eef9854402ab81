// How a subcommand ends.
#pragma once

#include "Client/Client.h"
#include "Tools/tessaryctl/Output.h"

// Prints the result of a call, or what went wrong. Returns the exit status.
template <typename T, typename Print>
int finish(const tessary::Result<T>& result, Print&& print) {
  if (!result) return complain(result.error());
  print(*result);
  return kDone;
}

inline int finish(const tessary::Result<void>& result) {
  return result ? kDone : complain(result.error());
}

// A child process of a test.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

struct Finished {
  int exitStatus = -1;  // 128 + the signal when one ended it
  std::string output;
  std::string errors;
};

// Runs a program (arguments[0] is its path) to its end.
Finished runToEnd(const std::vector<std::string>& arguments);

// Starts a program with what it writes appended to `logFile`; the caller reaps it.
pid_t startInBackground(const std::vector<std::string>& arguments, const std::string& logFile);

// Waits for a child and returns its exit status, 128 + the signal when one ended it.
int waitForExit(pid_t child);

// Waits until `condition` holds; false when it does not within half a minute.
bool becomes(const std::function<bool()>& condition);

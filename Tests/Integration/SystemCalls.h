// The system calls with which a running daemon serves one request, seen and changed from outside.
//
// All threads of the process are traced with ptrace(2) while one request runs. Looked at are the
// calls of the thread that serves it, from the arrival of its bytes to the sending of its reply,
// and of them those that reach the file system: before each one the test decides whether it
// happens, fails, or is the last thing that the process does.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

// close(2) and the like, which neither fail nor change a disk, are no such calls.
struct FileCall {
  std::string name;
  std::string path;          // as it was passed; empty when the call works on a descriptor alone
  bool changes = false;      // whether it may change what is on the disk
  bool locatesOnly = false;  // an open with O_PATH
};

struct Verdict {
  enum class Kind { proceed, fail, killBefore, killAfter };
  Kind kind = Kind::proceed;
  int error = 0;  // what the call fails with; it is not executed then
};

// Told of each call, numbered from 0.
using CallJudge = std::function<Verdict(const FileCall& call, size_t number)>;

// Why this process may not trace its children; empty when it may.
std::string whyNotTraceable();

// Runs `request`, which sends one request and takes its reply, in a thread of its own, and returns
// when the reply is on its way or the process is dead. A dead process is left for its parent to
// wait for. `process` must be a child of the caller and idle.
std::vector<FileCall> traceRequest(pid_t process, const std::function<void()>& request,
                                   const CallJudge& judge);

#include "Tests/Integration/Subprocess.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <stdexcept>
#include <thread>

#include "Platform/base/FileDescriptor.h"

using platform::FileDescriptor;

namespace {

pid_t spawn(const std::vector<std::string>& arguments, const FileDescriptor& output,
            const FileDescriptor& errors) {
  std::vector<char*> pointers;
  pointers.reserve(arguments.size() + 1);
  for (const std::string& argument : arguments) {
    pointers.push_back(const_cast<char*>(argument.c_str()));
  }
  pointers.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  ::posix_spawn_file_actions_init(&actions);
  ::posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  ::posix_spawn_file_actions_adddup2(&actions, output.get(), STDOUT_FILENO);
  ::posix_spawn_file_actions_adddup2(&actions, errors.get(), STDERR_FILENO);
  pid_t child = -1;
  const int failure =
      ::posix_spawn(&child, pointers[0], &actions, nullptr, pointers.data(), environ);
  ::posix_spawn_file_actions_destroy(&actions);
  if (failure != 0) throw std::runtime_error("cannot start " + arguments[0]);
  return child;
}

std::string contentOf(const FileDescriptor& file) {
  struct stat status{};
  ::fstat(file.get(), &status);
  std::string text(static_cast<size_t>(status.st_size), '\0');
  return ::pread(file.get(), text.data(), text.size(), 0) < 0 ? std::string() : text;
}

}  // namespace

Finished runToEnd(const std::vector<std::string>& arguments) {
  const FileDescriptor output(::memfd_create("output", MFD_CLOEXEC));
  const FileDescriptor errors(::memfd_create("errors", MFD_CLOEXEC));
  const int status = waitForExit(spawn(arguments, output, errors));
  return {.exitStatus = status, .output = contentOf(output), .errors = contentOf(errors)};
}

pid_t startInBackground(const std::vector<std::string>& arguments, const std::string& logFile) {
  const FileDescriptor log(
      ::open(logFile.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
  return spawn(arguments, log, log);
}

int waitForExit(pid_t child) {
  constexpr int kSignalBase = 128;
  int status = 0;
  while (::waitpid(child, &status, 0) < 0 && errno == EINTR) {
  }
  return WIFEXITED(status) ? WEXITSTATUS(status) : kSignalBase + WTERMSIG(status);
}

bool becomes(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

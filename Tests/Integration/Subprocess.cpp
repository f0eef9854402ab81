#include "Tests/Integration/Subprocess.h"

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <stdexcept>

#include "Platform/base/FileDescriptor.h"

using platform::FileDescriptor;

namespace {

struct Pipe {
  FileDescriptor reading;
  FileDescriptor writing;
};

Pipe makePipe() {
  std::array<int, 2> ends{};
  if (::pipe2(ends.data(), O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
  return {FileDescriptor(ends[0]), FileDescriptor(ends[1])};
}

std::vector<char*> argumentPointers(const std::vector<std::string>& arguments) {
  std::vector<char*> pointers;
  pointers.reserve(arguments.size() + 1);
  for (const std::string& argument : arguments) {
    pointers.push_back(const_cast<char*>(argument.c_str()));
  }
  pointers.push_back(nullptr);
  return pointers;
}

pid_t spawn(const std::vector<std::string>& arguments, posix_spawn_file_actions_t* actions) {
  pid_t child = -1;
  const int failure = ::posix_spawn(&child, arguments[0].c_str(), actions, nullptr,
                                    argumentPointers(arguments).data(), environ);
  ::posix_spawn_file_actions_destroy(actions);
  if (failure != 0) throw std::runtime_error("cannot start " + arguments[0]);
  return child;
}

// Reads both pipes until both are closed, so that neither can fill up.
void drain(const FileDescriptor& output, std::string& outputText, const FileDescriptor& errors,
           std::string& errorText) {
  std::array<pollfd, 2> pipes{{{output.get(), POLLIN, 0}, {errors.get(), POLLIN, 0}}};
  const std::array<std::string*, 2> texts{&outputText, &errorText};
  for (int open = 2; open > 0;) {
    ::poll(pipes.data(), pipes.size(), -1);
    for (size_t i = 0; i < pipes.size(); ++i) {
      if (pipes[i].fd < 0 || pipes[i].revents == 0) continue;
      std::array<char, 4096> buffer{};
      const ssize_t count = ::read(pipes[i].fd, buffer.data(), buffer.size());
      if (count > 0) {
        texts[i]->append(buffer.data(), static_cast<size_t>(count));
      } else {
        pipes[i].fd = -1;
        --open;
      }
    }
  }
}

}  // namespace

Finished runToEnd(const std::vector<std::string>& arguments) {
  Pipe output = makePipe();
  Pipe errors = makePipe();
  posix_spawn_file_actions_t actions;
  ::posix_spawn_file_actions_init(&actions);
  ::posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  ::posix_spawn_file_actions_adddup2(&actions, output.writing.get(), STDOUT_FILENO);
  ::posix_spawn_file_actions_adddup2(&actions, errors.writing.get(), STDERR_FILENO);
  const pid_t child = spawn(arguments, &actions);
  output.writing.reset();
  errors.writing.reset();
  Finished finished;
  drain(output.reading, finished.output, errors.reading, finished.errors);
  finished.exitStatus = waitForExit(child);
  return finished;
}

pid_t startInBackground(const std::vector<std::string>& arguments, const std::string& errorFile) {
  posix_spawn_file_actions_t actions;
  ::posix_spawn_file_actions_init(&actions);
  ::posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  ::posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, errorFile.c_str(),
                                     O_WRONLY | O_CREAT | O_APPEND, 0644);
  return spawn(arguments, &actions);
}

int waitForExit(pid_t child) {
  constexpr int kSignalBase = 128;
  int status = 0;
  while (::waitpid(child, &status, 0) < 0 && errno == EINTR) {
  }
  return WIFEXITED(status) ? WEXITSTATUS(status) : kSignalBase + WTERMSIG(status);
}

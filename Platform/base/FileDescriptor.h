// An owned file descriptor, closed when its owner goes.
#pragma once

#include <unistd.h>

#include <utility>

namespace platform {

class FileDescriptor {
 public:
  FileDescriptor() = default;
  explicit FileDescriptor(int descriptor) : descriptor_(descriptor) {}
  ~FileDescriptor() { reset(); }

  FileDescriptor(FileDescriptor&& other) noexcept
      : descriptor_(std::exchange(other.descriptor_, -1)) {}
  FileDescriptor& operator=(FileDescriptor&& other) noexcept {
    if (this != &other) {
      reset();
      descriptor_ = std::exchange(other.descriptor_, -1);
    }
    return *this;
  }

  int get() const { return descriptor_; }
  bool valid() const { return descriptor_ >= 0; }
  // Gives the descriptor away: the caller closes it from now on.
  int release() { return std::exchange(descriptor_, -1); }
  // Closes the descriptor, leaving errno as it was.
  void reset();

 private:
  int descriptor_ = -1;
};

}  // namespace platform

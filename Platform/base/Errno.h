// The failure of a system call, and the result type of everything that fails with one.
#pragma once

#include <cerrno>
#include <cstring>
#include <expected>
#include <string>

namespace platform {

struct Errno {
  int value = 0;

  // The system's text for the number, such as "No such file or directory". Any thread.
  std::string message() const;
  bool operator==(const Errno&) const = default;
};

// The calling thread's errno as the failure side of a Result.
inline std::unexpected<Errno> lastErrno() {
  return std::unexpected(Errno{errno});
}
inline std::unexpected<Errno> failWith(int value) {
  return std::unexpected(Errno{value});
}

template <typename T>
class [[nodiscard]] Result : public std::expected<T, Errno> {
 public:
  using std::expected<T, Errno>::expected;
  // Written out because GCC 12 takes the inherited one to leave something uninitialised.
  constexpr Result() {}  // NOLINT(modernize-use-equals-default)
};

}  // namespace platform

#include "Platform/os/AuditToken.h"

#include <fcntl.h>
#include <fmt/core.h>

#include <string_view>

#include "Platform/base/FileDescriptor.h"
#include "Platform/base/WholeNumber.h"
#include "Platform/os/OpenFile.h"

namespace platform {
namespace {

// The field with the given number, counted from 1. The second one is the name of the program in
// parentheses, which may itself hold spaces and parentheses: counting starts after the last ")".
std::string_view fieldOfStat(std::string_view stat, int number) {
  const size_t end = stat.rfind(')');
  if (end == std::string_view::npos) return {};
  stat.remove_prefix(end + 1);
  for (int field = 3;; ++field) {
    const size_t begin = stat.find_first_not_of(' ');
    if (begin == std::string_view::npos) return {};
    stat.remove_prefix(begin);
    const size_t length = std::min(stat.find(' '), stat.size());
    if (field == number) return stat.substr(0, length);
    stat.remove_prefix(length);
  }
}

}  // namespace

std::array<uint8_t, 32> AuditToken::bytes() const {
  std::array<uint8_t, 32> bytes{};
  for (size_t i = 0; i < bytes.size(); ++i) {
    bytes[i] = static_cast<uint8_t>(words[i / 4] >> (i % 4 * 8));
  }
  return bytes;
}

AuditToken AuditToken::make(uid_t uid, gid_t gid, pid_t pid, uint64_t startTime) {
  return {{uid, gid, uid, gid, 0, static_cast<uint32_t>(pid), static_cast<uint32_t>(startTime),
           static_cast<uint32_t>(startTime >> 32)}};
}

Result<uint64_t> processStartTime(pid_t pid) {
  constexpr int kStartTimeField = 22;
  constexpr size_t kLongestStat = 64 * 1024;
  const std::string path = fmt::format("/proc/{}/stat", pid);
  const FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!file.valid()) return failWith(errno == ENOENT ? ESRCH : errno);
  const auto stat = readToEnd(file.get(), kLongestStat);
  if (!stat) return std::unexpected(stat.error());
  const auto startTime = wholeNumber<uint64_t>(fieldOfStat(asText(*stat), kStartTimeField));
  if (!startTime) return failWith(EIO);
  return *startTime;
}

}  // namespace platform

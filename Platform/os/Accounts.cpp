#include "Platform/os/Accounts.h"

#include <grp.h>
#include <pwd.h>

#include <algorithm>
#include <limits>

#include "Platform/base/WholeNumber.h"
#include "Platform/os/OpenFile.h"
#include "Platform/os/PlatformLog.h"

namespace platform {
namespace {

constexpr size_t kLongestFile = 16 * 1024 * 1024;

std::vector<std::string_view> split(std::string_view text, char separator) {
  std::vector<std::string_view> parts;
  for (;;) {
    const size_t length = std::min(text.find(separator), text.size());
    parts.push_back(text.substr(0, length));
    if (length == text.size()) return parts;
    text.remove_prefix(length + 1);
  }
}

// (uint32_t)-1 means "leave it" to chown(2) and setuid(2): it is nobody's number.
std::optional<uint32_t> idFromText(std::string_view text) {
  const auto number = wholeNumber<uint32_t>(text);
  return number == std::numeric_limits<uint32_t>::max() ? std::nullopt : number;
}

std::string homeUnderRoot(const std::string& root, std::string_view home) {
  while (home.size() > 1 && home.ends_with('/')) home.remove_suffix(1);
  return root + std::string(home);
}

// name:password:uid:gid:description:home:shell
std::optional<Account> accountFromLine(std::string_view line, const std::string& root) {
  const auto fields = split(line, ':');
  if (fields.size() != 7 || fields[0].empty() || !fields[5].starts_with('/')) return std::nullopt;
  const auto uid = idFromText(fields[2]);
  const auto gid = idFromText(fields[3]);
  if (!uid || !gid) return std::nullopt;
  return Account{std::string(fields[0]), *uid, *gid, homeUnderRoot(root, fields[5])};
}

// name:password:gid:members
std::optional<Group> groupFromLine(std::string_view line) {
  const auto fields = split(line, ':');
  if (fields.size() != 4 || fields[0].empty()) return std::nullopt;
  const auto gid = idFromText(fields[2]);
  if (!gid) return std::nullopt;
  Group group{std::string(fields[0]), *gid, {}};
  for (const std::string_view member : split(fields[3], ',')) {
    if (!member.empty()) group.members.emplace_back(member);
  }
  return group;
}

// A file as it was when it was read.
struct ReadFile {
  std::vector<uint8_t> bytes;
  struct stat status;
};

Result<ReadFile> readRegularFile(const FileSystem& files, const std::string& path) {
  const auto file = files.openItem(path);
  if (!file) return std::unexpected(file.error());
  struct stat status{};
  if (::fstat(file->get(), &status) != 0 || !S_ISREG(status.st_mode)) return failWith(EINVAL);
  auto bytes = readToEnd(file->get(), kLongestFile);
  if (!bytes) return std::unexpected(bytes.error());
  return ReadFile{*std::move(bytes), status};
}

// Malformed lines are passed over, as the C library does.
template <typename Entry, typename FromLine>
std::vector<Entry> parse(std::string_view text, const std::string& path, const FromLine& fromLine) {
  std::vector<Entry> entries;
  size_t malformed = 0;
  for (const std::string_view line : split(text, '\n')) {
    if (line.empty() || line.front() == '#') continue;
    if (auto entry = fromLine(line)) {
      entries.push_back(*std::move(entry));
    } else {
      ++malformed;
    }
  }
  if (malformed > 0) {
    platformLog(LogLevel::error, "Accounts::parse", "{}: {} malformed lines are passed over", path,
                malformed);
  }
  return entries;
}

template <typename Entry, typename Matches>
std::optional<Entry> firstOf(const std::vector<Entry>& entries, const Matches& matches) {
  const auto found = std::find_if(entries.begin(), entries.end(), matches);
  return found == entries.end() ? std::nullopt : std::optional<Entry>(*found);
}

// Calls one of the C library's reentrant look-ups with a buffer that is large enough.
template <typename Entry, typename Lookup>
bool lookUp(Entry& entry, std::vector<char>& buffer, const Lookup& lookup) {
  constexpr size_t kLargestBuffer = 16 * 1024 * 1024;
  Entry* result = nullptr;
  buffer.resize(4096);
  while (lookup(&entry, buffer.data(), buffer.size(), &result) == ERANGE &&
         buffer.size() < kLargestBuffer) {
    buffer.resize(buffer.size() * 2);
  }
  return result != nullptr;
}

template <typename Lookup>
std::optional<Account> systemAccount(const std::string& root, const Lookup& lookup) {
  passwd entry{};
  std::vector<char> buffer;
  if (!lookUp(entry, buffer, lookup)) return std::nullopt;
  return Account{entry.pw_name, entry.pw_uid, entry.pw_gid, homeUnderRoot(root, entry.pw_dir)};
}

std::vector<gid_t> systemGroupsOfAccount(const Account& account) {
  int count = 64;
  std::vector<gid_t> groups(static_cast<size_t>(count));
  while (::getgrouplist(account.name.c_str(), account.gid, groups.data(), &count) < 0) {
    groups.resize(std::max(groups.size() * 2, static_cast<size_t>(count)));
    count = static_cast<int>(groups.size());
  }
  groups.resize(static_cast<size_t>(count));
  return groups;
}

}  // namespace

template <typename Entry, typename FromLine>
const std::vector<Entry>* Accounts::refresh(Database<Entry>& database, const char* name,
                                            const FromLine& fromLine) const {
  const std::string path = files_.root() + name;
  const auto status = files_.status(path);
  if (!status && status.error().value == ENOENT) return nullptr;
  if (status && database.stamp == Stamp(*status)) return &database.entries;
  const auto file = readRegularFile(files_, path);
  if (!file) {
    // What was good last stays, and reading is tried again: one line in the log for each state.
    if (!status || database.unreadable != Stamp(*status)) {
      platformLog(LogLevel::error, "Accounts::refresh", "{} cannot be read: {}", path,
                  file.error().message());
    }
    if (status) database.unreadable = Stamp(*status);
    return &database.entries;
  }
  database.entries = parse<Entry>(asText(file->bytes), path, fromLine);
  database.stamp = Stamp(file->status);
  return &database.entries;
}

const std::vector<Account>* Accounts::accounts() const {
  return refresh(accounts_, "/etc/passwd",
                 [this](std::string_view line) { return accountFromLine(line, files_.root()); });
}

const std::vector<Group>* Accounts::groups() const {
  return refresh(groups_, "/etc/group", groupFromLine);
}

std::optional<Account> Accounts::accountNamed(const std::string& name) const {
  const MutexLock lock(mutex_);
  if (const auto* const known = accounts()) {
    return firstOf(*known, [&](const Account& account) { return account.name == name; });
  }
  return systemAccount(files_.root(),
                       [&](auto... arguments) { return ::getpwnam_r(name.c_str(), arguments...); });
}

std::optional<Account> Accounts::accountWithUID(uid_t uid) const {
  const MutexLock lock(mutex_);
  if (const auto* const known = accounts()) {
    return firstOf(*known, [&](const Account& account) { return account.uid == uid; });
  }
  return systemAccount(files_.root(),
                       [&](auto... arguments) { return ::getpwuid_r(uid, arguments...); });
}

std::optional<gid_t> Accounts::groupNamed(const std::string& name) const {
  const MutexLock lock(mutex_);
  if (const auto* const known = groups()) {
    const auto found = firstOf(*known, [&](const Group& group) { return group.name == name; });
    return found ? std::optional(found->gid) : std::nullopt;
  }
  group entry{};
  std::vector<char> buffer;
  const bool found = lookUp(
      entry, buffer, [&](auto... arguments) { return ::getgrnam_r(name.c_str(), arguments...); });
  return found ? std::optional(entry.gr_gid) : std::nullopt;
}

std::vector<gid_t> Accounts::groupsOfAccount(const Account& account) const {
  const MutexLock lock(mutex_);
  const auto* const known = groups();
  if (known == nullptr) return systemGroupsOfAccount(account);
  std::vector<gid_t> result{account.gid};
  for (const Group& group : *known) {
    const bool isMember = std::ranges::find(group.members, account.name) != group.members.end();
    if (isMember && group.gid != account.gid) result.push_back(group.gid);
  }
  return result;
}

}  // namespace platform

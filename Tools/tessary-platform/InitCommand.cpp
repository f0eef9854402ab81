// init: what a device needs before anything runs on it. Whatever is there already stays as it is,
// so the command may be given again, with more users.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <optional>
#include <string_view>
#include <vector>

#include "Platform/base/WholeNumber.h"
#include "Platform/os/Accounts.h"
#include "Platform/os/OpenFile.h"
#include "Platform/os/RuntimeDirectory.h"
#include "Tools/tessary-platform/Command.h"

namespace {

using platform::FileSystem;

constexpr gid_t kSystemUsersGID = 250;
constexpr char kOSRelease[] =
    "NAME=\"Tessary\"\nID=tessary\nVERSION_ID=1.0\nBUILD_ID=1A1\nVARIANT_ID=release\n";

struct User {
  std::string name;
  uid_t uid;
  gid_t gid;
  std::string home;  // below the root
};

// "NAME:UID". The user's group has the same name and number.
std::optional<User> userFromArgument(const std::string& argument) {
  const size_t colon = argument.find(':');
  if (colon == std::string::npos) return std::nullopt;
  const std::string name = argument.substr(0, colon);
  const auto isNameCharacter = [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '_' || c == '-';
  };
  if (name.empty() || name[0] == '-' || !std::ranges::all_of(name, isNameCharacter)) {
    return std::nullopt;
  }
  const auto uid = platform::wholeNumber<uid_t>(std::string_view(argument).substr(colon + 1));
  if (!uid || *uid >= platform::kNobodyAccount) return std::nullopt;
  return User{name, *uid, *uid, "/private/var/users/" + name};
}

// Without root's rights nothing can be given to another user, so mobile is the caller.
User mobile() {
  const bool isRoot = ::geteuid() == 0;
  return {"mobile", isRoot ? kMobileUID : ::geteuid(), isRoot ? kMobileUID : ::getegid(),
          "/private/var/mobile"};
}

// A database of lines "name:password:number:...", to which entries are added.
class AccountFile {
 public:
  AccountFile(const FileSystem& files, const std::string& path)
      : files_(files), path_(files.root() + path) {}

  platform::Result<void> read() {
    constexpr size_t kLongestFile = 16 * 1024 * 1024;
    const auto bytes = files_.readFile(path_, kLongestFile);
    if (!bytes && bytes.error().value == ENOENT) return {};
    if (!bytes) return std::unexpected(bytes.error());
    text_.assign(bytes->begin(), bytes->end());
    if (!text_.empty() && text_.back() != '\n') text_ += '\n';
    return {};
  }

  // The number of a name that is there.
  std::optional<std::string> numberOf(const std::string& name) const {
    size_t begin = text_.starts_with(name + ":") ? 0 : text_.find("\n" + name + ":");
    if (begin == std::string::npos) return std::nullopt;
    for (int field = 0; field < 2; ++field) begin = text_.find(':', begin) + 1;
    return text_.substr(begin, text_.find_first_of(":\n", begin) - begin);
  }

  void add(const std::string& name, const std::string& line) {
    if (numberOf(name)) return;
    text_ += line + "\n";
    changed_ = true;
  }

  platform::Result<void> write() const {
    if (!changed_) return {};
    const auto status = files_.status(path_);
    const mode_t mode = status ? status->st_mode & 07777U : 0644;
    return files_.writeFile(path_, platform::asBytes(text_), {.mode = mode, .atomic = true});
  }

 private:
  const FileSystem& files_;
  const std::string path_;
  std::string text_;
  bool changed_ = false;
};

platform::Result<void> addAccounts(AccountFile& passwords, AccountFile& groups,
                                   const std::vector<User>& users) {
  for (const User& user : users) {
    groups.add(user.name, fmt::format("{}:x:{}:", user.name, user.gid));
    passwords.add(user.name, fmt::format("{}:x:{}:{}:{}:{}:/bin/sh", user.name, user.uid, user.gid,
                                         user.name, user.home));
  }
  groups.add(platform::kSystemUsersGroup,
             fmt::format("{}:x:{}:", platform::kSystemUsersGroup, kSystemUsersGID));
  if (const auto written = groups.write(); !written) return written;
  return passwords.write();
}

platform::Result<void> makeHome(const FileSystem& files, const User& user) {
  const std::string home = files.root() + user.home;
  if (const auto made = files.makePath(home.substr(0, home.rfind('/')), 0755); !made) return made;
  const auto made = files.makeDirectory(home, 0755);
  if (!made && made.error().value == EEXIST) return {};
  if (!made) return made;
  const auto place = files.locate(home);
  if (!place) return std::unexpected(place.error());
  return files.setOwnerAt(place->parent.get(), place->name, user.uid, user.gid);
}

platform::Result<void> makeTemporaryDirectory(const FileSystem& files) {
  const auto made = files.makeDirectory(files.root() + "/tmp", 01777);
  if (!made && made.error().value != EEXIST) return made;
  return {};
}

platform::Result<void> writeOSRelease(const FileSystem& files) {
  const std::string path = files.root() + "/etc/os-release";
  const auto isThere = [&](const std::string& name) { return files.status(name).has_value(); };
  if (isThere(path) || isThere(files.root() + "/usr/lib/os-release")) return {};
  return files.writeFile(path, platform::asBytes(kOSRelease), {.atomic = true});
}

int complainOf(const std::string& what, platform::Errno error) {
  return complain(kFailed, fmt::format("{}: {}", what, error.message()));
}

int prepareDevice(const FileSystem& files, const std::vector<User>& users) {
  // Two at once would lose the accounts of one.
  const auto lock = platform::lockRuntimeDirectory(files);
  if (!lock) return complainOf("the lock of run/tessary", lock.error());
  const std::string configuration = platform::configurationDirectory(files);
  if (const auto made = files.makePath(configuration, 0755); !made) {
    return complainOf(configuration, made.error());
  }
  AccountFile passwords(files, "/etc/passwd");
  AccountFile groups(files, "/etc/group");
  if (const auto read = passwords.read(); !read) return complainOf("etc/passwd", read.error());
  if (const auto read = groups.read(); !read) return complainOf("etc/group", read.error());
  for (const User& user : users) {
    const auto number = passwords.numberOf(user.name);
    if (number.value_or(std::to_string(user.uid)) != std::to_string(user.uid)) {
      return complain(kFailed,
                      fmt::format("{} is there already with the user id {}", user.name, *number));
    }
  }
  if (const auto added = addAccounts(passwords, groups, users); !added) {
    return complainOf("accounts", added.error());
  }
  for (const User& user : users) {
    if (const auto made = makeHome(files, user); !made) return complainOf(user.home, made.error());
  }
  if (const auto made = makeTemporaryDirectory(files); !made) {
    return complainOf("tmp", made.error());
  }
  if (const auto written = writeOSRelease(files); !written) {
    return complainOf("etc/os-release", written.error());
  }
  return kDone;
}

int init(const Application& application, const std::vector<std::string>& arguments) {
  std::vector<User> users{{"root", 0, 0, "/private/var/root"}, mobile()};
  for (const std::string& argument : arguments) {
    auto user = userFromArgument(argument);
    if (!user) return complain(kBadUsage, fmt::format("--user {}: not NAME:UID", argument));
    const auto hasUID = [&](const User& other) { return other.uid == user->uid; };
    if (std::ranges::any_of(users, hasUID)) {
      return complain(kBadUsage, fmt::format("--user {}: the user id is another's", argument));
    }
    users.push_back(*std::move(user));
  }
  if (::mkdir(application.root.c_str(), 0755) != 0 && errno != EEXIST) {
    return complainOf(application.root, {errno});
  }
  const auto files = openPreparedRoot(application);
  return files == nullptr ? kFailed : prepareDevice(*files, users);
}

}  // namespace

void addInitCommand(Application& application) {
  auto* const command = application.cli.add_subcommand(
      "init", "Prepare a device: accounts, home directories, tmp, etc/os-release");
  const auto users = std::make_shared<std::vector<std::string>>();
  command->add_option("--user", *users, "An account to add, with a home of its own")
      ->type_name("NAME:UID")
      ->take_all();
  command->callback([&application, users] {
    application.chosen = [&application, users] { return init(application, *users); };
  });
}

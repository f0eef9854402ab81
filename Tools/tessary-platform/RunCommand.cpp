// run: starts a program as an application. Its record is written under the process's own pid and
// start time before anything is given up or executed: exec keeps both, so the program has its
// identity from its first instruction on.
#include <grp.h>
#include <unistd.h>

#include <optional>
#include <vector>

#include "Platform/os/Accounts.h"
#include "Platform/os/Tasks.h"
#include "Tools/PropertyListFile.h"
#include "Tools/tessary-platform/Command.h"

namespace {

using platform::Account;
using platform::TaskRecord;

struct RunOptions {
  std::string identifier;
  std::string entitlements;
  bool sandboxed = false;
  std::optional<std::string> persona;
  bool kernel = false;
  std::optional<uid_t> uid;
  std::optional<gid_t> gid;
  std::vector<std::string> command;
};

// The dictionary in a file of the caller's; none, with a complaint, when there is none in it.
std::shared_ptr<const platform::Value::Dictionary> readEntitlements(const std::string& path) {
  auto entitlements = readDictionaryFile(path);
  if (!entitlements) {
    complain(kBadUsage, fmt::format("--entitlements {}: {}", path, entitlements.error()));
    return nullptr;
  }
  return std::make_shared<const platform::Value::Dictionary>(*std::move(entitlements));
}

// Who the program is to run as: mobile, unless the options say otherwise.
std::optional<Account> accountFor(const platform::Accounts& accounts, const RunOptions& options) {
  auto account =
      options.uid ? accounts.accountWithUID(*options.uid) : accounts.accountNamed("mobile");
  if (!account && options.uid && options.gid) account = Account{"", *options.uid, *options.gid, ""};
  if (account && options.gid) account->gid = *options.gid;
  return account;
}

bool isCaller(const Account& account) {
  return account.uid == ::geteuid() && account.gid == ::getegid();
}

// Groups first, user last: each step needs the rights that the next one gives up.
platform::Result<void> become(const Account& account, const std::vector<gid_t>& groups) {
  if (::geteuid() != 0 && isCaller(account)) return {};
  if (::setgroups(groups.size(), groups.data()) != 0 ||
      ::setresgid(account.gid, account.gid, account.gid) != 0 ||
      ::setresuid(account.uid, account.uid, account.uid) != 0) {
    return platform::lastErrno();
  }
  return {};
}

platform::Result<void> writeRecord(const platform::FileSystem& files, const TaskRecord& record) {
  const auto startTime = platform::processStartTime(::getpid());
  if (!startTime) return std::unexpected(startTime.error());
  return platform::Tasks(files).write(::getpid(), *startTime, record);
}

int execute(const std::vector<std::string>& command) {
  std::vector<char*> arguments;
  arguments.reserve(command.size() + 1);
  for (const std::string& argument : command) {
    arguments.push_back(const_cast<char*>(argument.c_str()));
  }
  arguments.push_back(nullptr);
  ::execvp(arguments[0], arguments.data());
  return complain(kFailed, fmt::format("{}: {}", command[0], platform::Errno{errno}.message()));
}

int run(const Application& application, const RunOptions& options) {
  TaskRecord record{.signingIdentifier = options.identifier,
                    .entitlements = nullptr,
                    .sandboxed = options.sandboxed,
                    .personaUniqueString = options.persona,
                    .kernelTask = options.kernel};
  if (!options.entitlements.empty()) {
    record.entitlements = readEntitlements(options.entitlements);
    if (record.entitlements == nullptr) return kBadUsage;
  }
  const auto files = openPreparedRoot(application);
  if (files == nullptr) return kFailed;
  const platform::Accounts accounts(*files);
  const auto account = accountFor(accounts, options);
  if (!account) return complain(kBadUsage, "no such account: --uid and --gid choose any other");
  if (const auto written = writeRecord(*files, record); !written) {
    return complain(kFailed, fmt::format("the record: {}", written.error().message()));
  }
  if (const auto became = become(*account, accounts.groupsOfAccount(*account)); !became) {
    return complain(kFailed, fmt::format("uid {}: {}", account->uid, became.error().message()));
  }
  return execute(options.command);
}

}  // namespace

void addRunCommand(Application& application) {
  auto* const command = application.cli.add_subcommand("run", "Run a program as an application");
  const auto options = std::make_shared<RunOptions>();
  command->add_option("--identifier", options->identifier, "Its code-signing identifier")
      ->required();
  command->add_option("--entitlements", options->entitlements, "A property list, a dictionary")
      ->type_name("FILE");
  command->add_flag("--sandboxed", options->sandboxed, "It is sandboxed");
  command->add_option("--persona", options->persona, "The unique string of its persona");
  command->add_flag("--kernel", options->kernel, "It speaks for the kernel");
  command->add_option("--uid", options->uid, "Its user, mobile otherwise");
  command->add_option("--gid", options->gid, "Its group, the user's otherwise");
  command->add_option("command", options->command, "The program and its arguments, after --")
      ->required();
  command->callback([&application, options] {
    application.chosen = [&application, options] { return run(application, *options); };
  });
}

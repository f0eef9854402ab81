#include "Tests/Integration/Device.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "Platform/os/Tasks.h"
#include "Platform/values/PropertyList.h"
#include "Tests/Integration/Subprocess.h"
#include "Tests/ScratchDirectory.h"

using platform::FileSystem;
using platform::Value;

namespace {

constexpr char kPrefix[] = "com.veltra.private.Tessary.";

void unmountBelow(const std::string& root) {
  std::ifstream mounts("/proc/self/mounts");
  for (std::string source, place, rest; mounts >> source >> place && std::getline(mounts, rest);) {
    if (place.starts_with(root + "/")) ::umount2(place.c_str(), MNT_DETACH);
  }
}

void writePropertyList(const std::string& path, const Value& value) {
  const auto bytes = platform::writeBinaryPropertyList(value);
  const std::string temporary = path + ".new";
  std::ofstream(temporary, std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes->data()),
             static_cast<std::streamsize>(bytes->size()));
  std::filesystem::rename(temporary, path);
}

// The N in "tessaryctl: TSYErrorNotFound (N): not found".
uint64_t codeIn(const std::string& errors) {
  const size_t open = errors.rfind(" (");
  return open == std::string::npos ? 0 : std::strtoull(errors.c_str() + open + 2, nullptr, 10);
}

}  // namespace

Caller Caller::with(const std::string& name, Value value) const {
  Caller caller = *this;
  caller.entitlements.insert_or_assign(kPrefix + name, std::move(value));
  return caller;
}

Caller privilegedCaller() {
  Caller caller;
  caller.identifier = "com.example.installer";
  return caller.with("allowed");
}

std::string contentOf(const std::string& path) {
  std::ostringstream content;
  content << std::ifstream(path, std::ios::binary).rdbuf();
  return content.str();
}

std::string Answer::text(const char* key) const {
  return json.is_object() && json.contains(key) ? json.at(key).get<std::string>() : std::string();
}

std::string Device::program(const std::string& name) {
  return std::string(TESSARY_BINARY_DIRECTORY) + "/" + name;
}

Device::Device(const std::string& parent, const std::string& user) {
  root_ = parent.empty() ? makeScratchDirectory() : makeScratchDirectory(parent);
  if (::chmod(root_.c_str(), 0755) != 0) throw std::runtime_error("chmod " + root_);
  std::vector<std::string> command = {program("tessary-platform"), "--root", root_, "init"};
  if (!user.empty()) command.insert(command.end(), {"--user", user});
  const Finished prepared = runToEnd(command);
  EXPECT_EQ(prepared.exitStatus, 0) << prepared.errors;
  reopenRoot();
}

Device::~Device() {
  kill();
  unmountBelow(root_);
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

void Device::start() {
  daemon_ = startInBackground({program("tessaryd"), "--root", root_}, root_ + "/system.log");
  // The socket of the daemon that ran before may still lie there: only an answer counts.
  ASSERT_TRUE(becomes([&] {
    auto client = tessary::Client::connect(root_);
    return client && client->personaList();
  })) << "the daemon does not answer: "
      << systemLog();
}

int Device::stop() {
  if (daemon_ <= 0) return -1;
  ::kill(daemon_, SIGTERM);
  const int status = waitForExit(daemon_);
  daemon_ = -1;
  return status;
}

void Device::kill() {
  if (daemon_ <= 0) return;
  ::kill(daemon_, SIGKILL);
  (void)waitForExit(daemon_);
  daemon_ = -1;
}

void Device::reopenRoot() {
  files_ = std::move(*FileSystem::open(root_, platform::Privilege::root));
}

std::string Device::systemLog() const {
  return contentOf(root_ + "/system.log");
}

std::string Device::daemonLog() const {
  return contentOf(root_ + "/private/var/root/Library/Logs/Tessary/tessaryd.log");
}

Answer Device::ask(const Caller& caller, const std::vector<std::string>& arguments) const {
  const std::string entitlements = root_ + "/entitlements-" + caller.identifier + ".plist";
  writePropertyList(entitlements, caller.entitlements);
  const std::string uid = std::to_string(caller.uid);
  std::vector<std::string> command = {program("tessary-platform"), "--root", root_, "run"};
  command.insert(command.end(), {"--identifier", caller.identifier});
  command.insert(command.end(), {"--entitlements", entitlements, "--uid", uid, "--gid", uid});
  if (caller.sandboxed) command.emplace_back("--sandboxed");
  if (caller.persona) command.insert(command.end(), {"--persona", *caller.persona});
  command.insert(command.end(), {"--", program("tessaryctl"), "--root", root_, "--json"});
  command.insert(command.end(), arguments.begin(), arguments.end());
  const Finished finished = runToEnd(command);
  const bool isDone = finished.exitStatus == 0;
  return {.code = isDone ? 1 : codeIn(finished.errors),
          .json = isDone ? nlohmann::json::parse(finished.output, nullptr, /*exceptions=*/false)
                         : nlohmann::json(),
          .errors = finished.errors};
}

Answer Device::askFor(const char* command, const Caller& caller, const std::string& identifier,
                      uint64_t containerClass) const {
  std::vector<std::string> arguments = {command, "--class", std::to_string(containerClass)};
  if (!identifier.empty()) arguments.push_back(identifier);
  return ask(caller, arguments);
}

tessary::Client Device::connect(const Caller& caller) const {
  const auto startTime = platform::processStartTime(::getpid());
  const auto written = platform::Tasks(*files_).write(
      ::getpid(), *startTime,
      {.signingIdentifier = caller.identifier,
       .entitlements = std::make_shared<const Value::Dictionary>(caller.entitlements),
       .sandboxed = caller.sandboxed,
       .personaUniqueString = caller.persona});
  if (!written) throw std::runtime_error("cannot write a record: " + written.error().message());
  auto client = tessary::Client::connect(root_);
  if (!client) throw std::runtime_error(client.error().text);
  EXPECT_TRUE(client->personaList());
  return std::move(*client);
}

void Device::setPersonas(const std::vector<Persona>& personas) const {
  Value::Array list;
  for (const Persona& persona : personas) {
    Value::Array bundles(persona.bundleIdentifiers.begin(), persona.bundleIdentifiers.end());
    Value::Dictionary entry{{"UniqueString", persona.uniqueString},
                            {"PersonaID", persona.personaID},
                            {"Kind", persona.kind},
                            {"BundleIdentifiers", std::move(bundles)}};
    if (!persona.layoutPath.empty()) entry.emplace("LayoutPath", persona.layoutPath);
    list.emplace_back(std::move(entry));
  }
  std::filesystem::create_directories(root_ + "/etc/tessary");
  writePropertyList(root_ + "/etc/tessary/personas.plist", list);
}

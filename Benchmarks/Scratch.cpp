#include "Benchmarks/Scratch.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <thread>

#include "Platform/fs/FileSystem.h"
#include "Platform/ipc/Codec.h"
#include "Platform/ipc/SocketPath.h"
#include "Platform/os/Tasks.h"
#include "Tests/ScratchDirectory.h"

using platform::FileDescriptor;
using platform::Value;
using platform::ipc::Message;

void die(std::string_view reason) {
  fmt::print(stderr, "benchmark: {}\n", reason);
  std::exit(EXIT_FAILURE);
}

namespace {

std::string makeRoot() {
  const std::string root = makeScratchDirectory();
  if (::chmod(root.c_str(), 0755) != 0) die("cannot chmod " + root);
  return root;
}

pid_t startProgram(const std::vector<std::string>& arguments) {
  std::vector<char*> pointers;
  pointers.reserve(arguments.size() + 1);
  for (const std::string& argument : arguments) {
    pointers.push_back(const_cast<char*>(argument.c_str()));
  }
  pointers.push_back(nullptr);
  const pid_t child = ::fork();
  if (child < 0) die("cannot fork");
  if (child != 0) return child;
  // The log of each request goes where it costs a write and nothing more.
  const int null = ::open("/dev/null", O_RDWR | O_CLOEXEC);
  if (null < 0 || ::dup2(null, STDERR_FILENO) < 0) ::_exit(EXIT_FAILURE);
  ::execv(pointers[0], pointers.data());
  ::_exit(EXIT_FAILURE);
}

void writeRecord(const std::string& root) {
  const auto files = platform::FileSystem::open(root, platform::Privilege::root);
  const auto startTime = platform::processStartTime(::getpid());
  const auto written = platform::Tasks(**files).write(
      ::getpid(), *startTime,
      {.signingIdentifier = "com.example.benchmark",
       .entitlements = std::make_shared<const Value::Dictionary>(
           Value::Dictionary{{"com.veltra.private.Tessary.allowed", true}}),
       .personaUniqueString = std::nullopt});
  if (!written) die("cannot write a record: " + written.error().message());
}

void readFully(int socket, uint8_t* bytes, size_t count) {
  while (count > 0) {
    const ssize_t got = ::read(socket, bytes, count);
    if (got <= 0) die("the peer has gone");
    bytes += got;
    count -= static_cast<size_t>(got);
  }
}

void sendFully(int socket, const std::vector<uint8_t>& bytes) {
  size_t sent = 0;
  while (sent < bytes.size()) {
    const ssize_t count = ::send(socket, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
    if (count <= 0) die("the peer has gone");
    sent += static_cast<size_t>(count);
  }
}

void echo(int socket, size_t requestSize, const std::vector<uint8_t>& reply) {
  std::vector<uint8_t> request(requestSize);
  for (;;) {
    for (size_t have = 0; have < requestSize;) {
      const ssize_t got = ::read(socket, request.data() + have, requestSize - have);
      if (got <= 0) {
        ::close(socket);
        return;
      }
      have += static_cast<size_t>(got);
    }
    if (::send(socket, reply.data(), reply.size(), MSG_NOSIGNAL) <= 0) return;
  }
}

[[noreturn]] void serveEcho(int listener, size_t requestSize, size_t replySize) {
  const std::vector<uint8_t> reply(replySize);
  for (;;) {
    const int socket = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (socket < 0) ::_exit(EXIT_FAILURE);
    std::thread(echo, socket, requestSize, reply).detach();
  }
}

platform::Result<FileDescriptor> connectToDaemon(const std::string& root) {
  return platform::ipc::connectTo(root + "/run/tessary/com.veltra.tessaryd", SOCK_STREAM);
}

std::vector<uint8_t> containerFrame(const std::string& identifier, bool createIfNecessary) {
  Message message;
  message.set("Command", uint64_t{0});
  message.set("Identifier", identifier);
  message.set("ContainerClass", uint64_t{2});
  message.set("CreateIfNecessary", createIfNecessary);
  return frameOf(message);
}

}  // namespace

ScratchDevice::ScratchDevice() : root_(makeRoot()) {
  const pid_t init = startProgram(
      {std::string(TESSARY_BINARY_DIRECTORY) + "/tessary-platform", "--root", root_, "init"});
  int status = 0;
  ::waitpid(init, &status, 0);
  if (status != 0) die("tessary-platform init failed");
}

ScratchDevice::~ScratchDevice() {
  stop();
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

void ScratchDevice::start() {
  daemon_ = startProgram({std::string(TESSARY_BINARY_DIRECTORY) + "/tessaryd", "--root", root_});
  writeRecord(root_);
  Message question;
  question.set("Command", uint64_t{32});
  const std::vector<uint8_t> frame = frameOf(question);
  for (int tries = 0; tries < 1000; ++tries) {
    if (const auto socket = connectToDaemon(root_)) {
      roundTripOfFrame(socket->get(), frame);
      return;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  die("the daemon does not answer");
}

void ScratchDevice::stop() {
  if (daemon_ <= 0) return;
  ::kill(daemon_, SIGTERM);
  ::waitpid(daemon_, nullptr, 0);
  daemon_ = -1;
}

void ScratchDevice::forgetMappings() const {
  std::filesystem::remove_all(root_ + "/run/tessary/sandbox");
}

uint64_t ScratchDevice::daemonMemory() const {
  std::ifstream status(fmt::format("/proc/{}/status", daemon_));
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("RssAnon:")) return std::strtoull(line.c_str() + 8, nullptr, 10) * 1024;
  }
  die("no RssAnon of the daemon");
}

FileDescriptor ScratchDevice::connect() const {
  auto socket = connectToDaemon(root_);
  if (!socket) die("cannot connect: " + socket.error().message());
  return std::move(*socket);
}

EchoServer::EchoServer(size_t requestSize, size_t replySize) : directory_(makeRoot()) {
  auto listener = platform::ipc::listenAt(directory_ + "/echo", SOCK_STREAM, 0600);
  if (!listener) die("cannot listen: " + listener.error().message());
  ::fcntl(listener->get(), F_SETFL, ::fcntl(listener->get(), F_GETFL) & ~O_NONBLOCK);
  process_ = ::fork();
  if (process_ < 0) die("cannot fork");
  if (process_ == 0) serveEcho(listener->get(), requestSize, replySize);
}

EchoServer::~EchoServer() {
  ::kill(process_, SIGKILL);
  ::waitpid(process_, nullptr, 0);
  std::filesystem::remove_all(directory_);
}

FileDescriptor EchoServer::connect() const {
  auto socket = platform::ipc::connectTo(directory_ + "/echo", SOCK_STREAM);
  if (!socket) die("cannot connect to the echo server: " + socket.error().message());
  return std::move(*socket);
}

std::vector<uint8_t> frameOf(const Message& message) {
  auto frame = platform::ipc::encodeFrame(message, /*sequence=*/1, /*flags=*/0);
  if (!frame) die(frame.error().reason);
  return std::move(*frame);
}

std::vector<uint8_t> lookupFrame(const std::string& identifier) {
  return containerFrame(identifier, /*createIfNecessary=*/false);
}

std::vector<uint8_t> createFrame(const std::string& identifier) {
  return containerFrame(identifier, /*createIfNecessary=*/true);
}

std::vector<uint8_t> roundTrip(int socket, const std::vector<uint8_t>& request, size_t replySize) {
  sendFully(socket, request);
  std::vector<uint8_t> reply(replySize);
  readFully(socket, reply.data(), reply.size());
  return reply;
}

std::vector<uint8_t> roundTripOfFrame(int socket, const std::vector<uint8_t>& request) {
  using platform::ipc::kFrameHeaderSize;
  std::vector<uint8_t> reply = roundTrip(socket, request, kFrameHeaderSize);
  const auto header =
      platform::ipc::decodeHeader(std::span<const uint8_t, kFrameHeaderSize>(reply));
  if (!header) die(header.error().reason);
  reply.resize(kFrameHeaderSize + header->bodyLength);
  readFully(socket, reply.data() + kFrameHeaderSize, header->bodyLength);
  return reply;
}

// What the benchmarks run on: a scratch device with the real daemon, and a bare echo server beside
// it. Both are processes of their own, so that a round trip is one between two processes.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/base/FileDescriptor.h"
#include "Platform/ipc/Message.h"

// Ends the benchmarks and says why.
[[noreturn]] void die(std::string_view reason);

class ScratchDevice {
 public:
  // Makes a root in the directory for temporary files and prepares it. Starts nothing.
  ScratchDevice();
  ~ScratchDevice();
  ScratchDevice(const ScratchDevice&) = delete;
  ScratchDevice& operator=(const ScratchDevice&) = delete;

  const std::string& root() const { return root_; }
  // Starts the daemon and waits until it answers, and ends it.
  void start();
  void stop();
  // Makes the sandbox forget the containers that it was told of. Between stop() and start().
  void forgetMappings() const;
  // Anonymous memory of the daemon that is in use, in bytes.
  uint64_t daemonMemory() const;

  // A connection of this process, which has every right.
  platform::FileDescriptor connect() const;

 private:
  std::string root_;
  pid_t daemon_ = -1;
};

// Answers every `requestSize` bytes with `replySize` bytes, with one blocking thread a connection:
// the least that a server on this kind of socket can do.
class EchoServer {
 public:
  EchoServer(size_t requestSize, size_t replySize);
  ~EchoServer();
  EchoServer(const EchoServer&) = delete;
  EchoServer& operator=(const EchoServer&) = delete;

  platform::FileDescriptor connect() const;

 private:
  std::string directory_;
  pid_t process_ = -1;
};

// A request as bytes: a whole frame.
std::vector<uint8_t> frameOf(const platform::ipc::Message& message);
std::vector<uint8_t> lookupFrame(const std::string& identifier);
std::vector<uint8_t> createFrame(const std::string& identifier);

// Sends a frame and reads the answer of known size; returns the answer.
std::vector<uint8_t> roundTrip(int socket, const std::vector<uint8_t>& request, size_t replySize);
// The same with an answer that tells its own size: a frame.
std::vector<uint8_t> roundTripOfFrame(int socket, const std::vector<uint8_t>& request);

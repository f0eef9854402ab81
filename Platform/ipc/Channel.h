// The client's end: one connection, one request at a time. Not for use by two threads at once.
#pragma once

#include <cstdint>
#include <expected>
#include <string>
#include <vector>

#include "Platform/base/FileDescriptor.h"
#include "Platform/ipc/Codec.h"
#include "Platform/ipc/Message.h"

namespace platform::ipc {

struct ChannelError {
  std::string reason;
};

class Channel {
 public:
  // Connects to a service's socket; paths of any length.
  static std::expected<Channel, ChannelError> connect(const std::string& socketPath);

  // Sends one request and waits for its reply, as long as it takes. After an error of the
  // connection or an answer that is not the reply the channel is closed; a request that cannot be
  // encoded leaves it open.
  std::expected<Message, ChannelError> call(const Message& request);

 private:
  explicit Channel(FileDescriptor socket) : socket_(std::move(socket)) {}

  std::expected<void, ChannelError> send(const std::vector<uint8_t>& frame);
  std::expected<Message, ChannelError> receive(uint32_t sequence);

  FileDescriptor socket_;
  uint32_t lastSequence_ = 0;
};

}  // namespace platform::ipc

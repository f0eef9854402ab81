#include "Platform/ipc/Channel.h"

#include <fmt/format.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <span>

#include "Platform/base/Errno.h"
#include "Platform/ipc/SocketPath.h"

namespace platform::ipc {
namespace {

// Enough for most replies, header and body, in one read.
constexpr size_t kFirstRead = 4096;

std::unexpected<ChannelError> fail(std::string reason) {
  return std::unexpected(ChannelError{std::move(reason)});
}

std::unexpected<ChannelError> failWithErrno(const char* operation) {
  return fail(fmt::format("{}: {}", operation, Errno{errno}.message()));
}

// Reads until at least `least` bytes are there, and at most what fits into `target`.
std::expected<size_t, ChannelError> readAtLeast(int socket, size_t least,
                                                std::span<uint8_t> target) {
  size_t size = 0;
  while (size < least) {
    const ssize_t count = ::recv(socket, target.data() + size, target.size() - size, 0);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return failWithErrno("receiving a reply");
    if (count == 0) return fail("the service has closed the connection");
    size += static_cast<size_t>(count);
  }
  return size;
}

}  // namespace

std::expected<Channel, ChannelError> Channel::connect(const std::string& socketPath) {
  auto socket = connectTo(socketPath, SOCK_STREAM);
  if (!socket) {
    return fail(fmt::format("connecting to {}: {}", socketPath, socket.error().message()));
  }
  return Channel(std::move(*socket));
}

std::expected<Message, ChannelError> Channel::call(const Message& request) {
  if (!socket_.valid()) return fail("the connection is closed");
  if (++lastSequence_ == 0) ++lastSequence_;  // 0 would ask for no reply
  const auto frame = encodeFrame(request, lastSequence_, 0);
  if (!frame) return fail("the request cannot be sent: " + frame.error().reason);
  if (const auto sent = send(*frame); !sent) {
    socket_.reset();
    return std::unexpected(sent.error());
  }
  auto reply = receive(lastSequence_);
  if (!reply) socket_.reset();
  return reply;
}

std::expected<void, ChannelError> Channel::send(const std::vector<uint8_t>& frame) {
  for (std::span<const uint8_t> rest(frame); !rest.empty();) {
    const ssize_t count = ::send(socket_.get(), rest.data(), rest.size(), MSG_NOSIGNAL);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return failWithErrno("sending a request");
    rest = rest.subspan(static_cast<size_t>(count));
  }
  return {};
}

std::expected<Message, ChannelError> Channel::receive(uint32_t sequence) {
  std::array<uint8_t, kFirstRead> first;  // filled by the read
  const auto received = readAtLeast(socket_.get(), kFrameHeaderSize, first);
  if (!received) return std::unexpected(received.error());
  const std::span<const uint8_t> bytes(first.data(), *received);
  const auto header = decodeHeader(bytes.first<kFrameHeaderSize>());
  if (!header) return fail("a malformed reply: " + header.error().reason);
  if (header->flags != kReplyFlag) return fail("a frame that is not a reply");
  if (header->sequence != sequence) return fail("a reply to another request");

  std::span<const uint8_t> body = bytes.subspan(kFrameHeaderSize);
  if (body.size() > header->bodyLength) return fail("bytes after the reply");
  std::vector<uint8_t> longBody;
  if (body.size() < header->bodyLength) {
    longBody.resize(header->bodyLength);
    std::ranges::copy(body, longBody.begin());
    const auto rest = std::span(longBody).subspan(body.size());
    const auto read = readAtLeast(socket_.get(), rest.size(), rest);
    if (!read) return std::unexpected(read.error());
    body = longBody;
  }
  auto reply = decodeMessage(body);
  if (!reply) return fail("a malformed reply: " + reply.error().reason);
  return std::move(*reply);
}

}  // namespace platform::ipc

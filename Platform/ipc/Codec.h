// Messages as CBOR (RFC 8949), and the 16-byte header of a frame. Docs/protocol.md has the format.
//
// The decoder streams: it allocates nothing that the bytes at hand do not justify. Malformed CBOR,
// a duplicate key, a key that is not text, text that is not UTF-8 or holds a NUL, an unknown tag
// and what is over the limits below are refused whole. Any thread.
#pragma once

#include <array>
#include <cstdint>
#include <expected>
#include <span>
#include <string>
#include <vector>

#include "Platform/ipc/Message.h"

namespace platform::ipc {

inline constexpr size_t kFrameHeaderSize = 16;
inline constexpr uint32_t kMaximumBodySize = 16 * 1024 * 1024;
// Arrays and maps inside each other, the body's own map included.
inline constexpr size_t kMaximumNesting = 64;
// Values in one message, the body's own map included, keys not: one byte of CBOR can become 56 in
// memory.
inline constexpr size_t kMaximumValues = 1024 * 1024;
inline constexpr uint32_t kReplyFlag = 1;

struct FrameHeader {
  uint32_t bodyLength = 0;
  uint32_t sequence = 0;  // the request's own number; 0: no reply context
  uint32_t flags = 0;
};

// Why bytes are no frame or no message. For log lines.
struct CodecError {
  std::string reason;
};

std::array<uint8_t, kFrameHeaderSize> encodeHeader(const FrameHeader& header);
// Refuses a wrong magic, a length over the limit and unknown flags.
std::expected<FrameHeader, CodecError> decodeHeader(
    std::span<const uint8_t, kFrameHeaderSize> bytes);

std::expected<Message, CodecError> decodeMessage(std::span<const uint8_t> body);
// A whole frame. Refuses what decodeMessage would refuse: a body over one of the limits and text
// that is not UTF-8 or holds a NUL.
std::expected<std::vector<uint8_t>, CodecError> encodeFrame(const Message& message,
                                                            uint32_t sequence, uint32_t flags);

}  // namespace platform::ipc

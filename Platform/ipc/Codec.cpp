// The frame header, and the encoder.
//
// The encoder appends to one buffer in one pass and refuses whatever the decoder at the other end
// would refuse, so that a message that was sent is a message that can be read.
#include "Platform/ipc/Codec.h"

#include <fmt/format.h>

#include <bit>
#include <cstring>

#include "Platform/ipc/Text.h"

namespace platform::ipc {
namespace {

constexpr std::array<uint8_t, 4> kMagic = {'T', 'S', 'Y', '1'};
// Most messages fit, and are written without the buffer having to grow.
constexpr size_t kUsualFrameSize = 256;

enum MajorType : uint8_t {
  kUnsigned = 0 << 5,
  kNegative = 1 << 5,
  kByteString = 2 << 5,
  kTextString = 3 << 5,
  kArray = 4 << 5,
  kMap = 5 << 5,
  kTag = 6 << 5,
};
constexpr uint8_t kFalse = 0xF4;
constexpr uint8_t kTrue = 0xF5;
constexpr uint8_t kNull = 0xF6;
constexpr uint8_t kDouble = 0xFB;
constexpr uint64_t kDateTag = 1;
constexpr uint64_t kUUIDTag = 37;

void storeLittleEndian(uint32_t value, uint8_t* target) {
  for (unsigned index = 0; index < 4; ++index) {
    target[index] = static_cast<uint8_t>(value >> (8 * index));
  }
}

uint32_t loadLittleEndian(const uint8_t* source) {
  uint32_t value = 0;
  for (unsigned index = 0; index < 4; ++index) {
    value |= static_cast<uint32_t>(source[index]) << (8 * index);
  }
  return value;
}

class Encoder {
 public:
  Encoder() {
    bytes_.reserve(kUsualFrameSize);
    bytes_.resize(kFrameHeaderSize);
  }

  // The frame with room for its header, or why there is none.
  std::expected<std::vector<uint8_t>, CodecError> frameOf(const Message& message) {
    write(message.values());
    if (failure_ != nullptr) return std::unexpected(CodecError{failure_});
    return std::move(bytes_);
  }

 private:
  void fail(const char* reason) { failure_ = reason; }

  void append(const void* bytes, size_t size) {
    const auto* first = static_cast<const uint8_t*>(bytes);
    bytes_.insert(bytes_.end(), first, first + size);
  }

  void writeBigEndian(uint8_t initial, uint64_t number, unsigned size) {
    std::array<uint8_t, 9> head = {initial};
    for (unsigned index = 0; index < size; ++index) {
      head[1 + index] = static_cast<uint8_t>(number >> (8 * (size - 1 - index)));
    }
    append(head.data(), 1 + size);
  }

  void writeHead(MajorType type, uint64_t number) {
    const auto initial = [type](unsigned low) { return static_cast<uint8_t>(type | low); };
    if (number < 24) {
      bytes_.push_back(initial(static_cast<unsigned>(number)));
    } else if (number <= UINT8_MAX) {
      writeBigEndian(initial(24), number, 1);
    } else if (number <= UINT16_MAX) {
      writeBigEndian(initial(25), number, 2);
    } else if (number <= UINT32_MAX) {
      writeBigEndian(initial(26), number, 4);
    } else {
      writeBigEndian(initial(27), number, 8);
    }
  }

  void write(std::monostate) { bytes_.push_back(kNull); }
  void write(bool value) { bytes_.push_back(value ? kTrue : kFalse); }
  void write(uint64_t value) { writeHead(kUnsigned, value); }
  void write(int64_t value) {
    const auto bits = static_cast<uint64_t>(value);
    value < 0 ? writeHead(kNegative, ~bits) : writeHead(kUnsigned, bits);
  }
  void write(double value) { writeBigEndian(kDouble, std::bit_cast<uint64_t>(value), 8); }
  void write(const std::string& value) {
    if (!isValidText(value)) return fail("text is not UTF-8 or holds a NUL");
    writeHead(kTextString, value.size());
    append(value.data(), value.size());
  }
  void write(const Value::Data& value) {
    writeHead(kByteString, value.size());
    append(value.data(), value.size());
  }
  void write(const UUID& value) {
    writeHead(kTag, kUUIDTag);
    writeHead(kByteString, value.bytes().size());
    append(value.bytes().data(), value.bytes().size());
  }
  void write(Date value) {
    writeHead(kTag, kDateTag);
    write(value.secondsSince1970);
  }
  void write(const Value::Array& values) {
    if (!enter()) return;
    writeHead(kArray, values.size());
    for (const Value& value : values) {
      if (!write(value)) return;
    }
    --depth_;
  }
  void write(const Value::Dictionary& values) {
    if (!enter()) return;
    writeHead(kMap, values.size());
    for (const auto& [key, value] : values) {
      write(key);
      if (!write(value)) return;
    }
    --depth_;
  }

  bool enter() {
    if (++depth_ > kMaximumNesting) fail("it is nested too deep");
    return failure_ == nullptr;
  }

  // Returns whether to go on: what is over a limit is not built to its end.
  bool write(const Value& value) {
    std::visit([this](const auto& content) { write(content); }, value.storage());
    if (++values_ > kMaximumValues) fail("it holds too many values");
    if (bytes_.size() - kFrameHeaderSize > kMaximumBodySize) fail("its body is too long");
    return failure_ == nullptr;
  }

  std::vector<uint8_t> bytes_;
  size_t depth_ = 0;
  size_t values_ = 1;  // the body's own map
  const char* failure_ = nullptr;
};

}  // namespace

std::array<uint8_t, kFrameHeaderSize> encodeHeader(const FrameHeader& header) {
  std::array<uint8_t, kFrameHeaderSize> bytes{};
  std::memcpy(bytes.data(), kMagic.data(), kMagic.size());
  storeLittleEndian(header.bodyLength, bytes.data() + 4);
  storeLittleEndian(header.sequence, bytes.data() + 8);
  storeLittleEndian(header.flags, bytes.data() + 12);
  return bytes;
}

std::expected<FrameHeader, CodecError> decodeHeader(
    std::span<const uint8_t, kFrameHeaderSize> bytes) {
  if (std::memcmp(bytes.data(), kMagic.data(), kMagic.size()) != 0) {
    return std::unexpected(CodecError{"a frame does not begin with \"TSY1\""});
  }
  const FrameHeader header = {.bodyLength = loadLittleEndian(bytes.data() + 4),
                              .sequence = loadLittleEndian(bytes.data() + 8),
                              .flags = loadLittleEndian(bytes.data() + 12)};
  if (header.bodyLength > kMaximumBodySize) {
    return std::unexpected(CodecError{fmt::format("a body of {} bytes", header.bodyLength)});
  }
  if ((header.flags & ~kReplyFlag) != 0) {
    return std::unexpected(CodecError{fmt::format("unknown frame flags {:#x}", header.flags)});
  }
  return header;
}

std::expected<std::vector<uint8_t>, CodecError> encodeFrame(const Message& message,
                                                            uint32_t sequence, uint32_t flags) {
  auto frame = Encoder().frameOf(message);
  if (!frame) return frame;
  const auto header =
      encodeHeader({.bodyLength = static_cast<uint32_t>(frame->size() - kFrameHeaderSize),
                    .sequence = sequence,
                    .flags = flags});
  std::memcpy(frame->data(), header.data(), header.size());
  return frame;
}

}  // namespace platform::ipc

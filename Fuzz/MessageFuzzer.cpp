// A frame as it comes from a peer: header and body. What decodes must encode, and decode to the
// same again.
//
// The header's length need not be right: the body is what follows, so that mutations of the body
// are not stopped by it.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "Platform/ipc/Codec.h"

using namespace platform::ipc;

namespace {

void require(bool condition) {
  if (!condition) std::abort();
}

void checkHeader(std::span<const uint8_t, kFrameHeaderSize> bytes) {
  const auto header = decodeHeader(bytes);
  if (!header) return;
  const auto encoded = encodeHeader(*header);
  require(std::equal(encoded.begin(), encoded.end(), bytes.begin()));
}

// Compared as bytes: a NaN is not equal to itself.
void checkBody(std::span<const uint8_t> body) {
  const auto message = decodeMessage(body);
  if (!message) return;
  const auto frame = encodeFrame(*message, 1, 0);
  // Only numbers become longer, to 64 bits; what no longer fits is refused, not cut.
  if (!frame) return require(body.size() > kMaximumBodySize / 4);
  const auto again = decodeMessage(std::span(*frame).subspan(kFrameHeaderSize));
  require(again.has_value());
  require(again->values().size() == message->values().size());
  require(encodeFrame(*again, 1, 0) == *frame);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
  if (size < kFrameHeaderSize) return 0;
  const std::span<const uint8_t> frame(bytes, size);
  checkHeader(frame.first<kFrameHeaderSize>());
  checkBody(frame.subspan(kFrameHeaderSize));
  return 0;
}

// The decoder: libcbor's streaming half calls back for each head and string, and the value grows in
// place.
//
// A level of the stack is an array or a map that is not complete yet; only the innermost one grows,
// so the pointers to the outer ones hold (a map's nodes never move, and an array does not grow
// while its last element is being filled). A key is entered as soon as it is read, with null for
// its value, and the value is then filled in. What a head claims is believed only as far as the
// bytes that follow could bear it out.
#include <cbor/callbacks.h>
#include <cbor/streaming.h>

#include <algorithm>
#include <cstring>
#include <limits>

#include "Platform/ipc/Codec.h"
#include "Platform/ipc/Text.h"

namespace platform::ipc {
namespace {

// What is set aside for an array before its elements have been seen.
constexpr size_t kMaximumReservation = 4096;
constexpr uint64_t kDateTag = 1;
constexpr uint64_t kUUIDTag = 37;

class Decoder {
 public:
  explicit Decoder(std::span<const uint8_t> body) : rest_(body) {}

  std::expected<Message, CodecError> run();

 private:
  struct Level {
    Value::Array* array;            // one of the two
    Value::Dictionary* dictionary;  // is set
    Value* slot;                    // of a map: where the value of the last key goes, or null
    uint64_t remaining;             // elements or pairs, of a definite one
    bool indefinite;
  };
  // A string that comes in chunks.
  enum class Chunks { none, text, data };

  static const cbor_callbacks kCallbacks;
  static Decoder& from(void* context) { return *static_cast<Decoder*>(context); }
  template <typename Number>
  static void unsignedNumber(void* context, Number number) {
    from(context).number(static_cast<uint64_t>(number));
  }
  // CBOR's negative number n stands for -1 - n.
  template <typename Number>
  static void negativeNumber(void* context, Number number) {
    from(context).negative(number);
  }
  template <typename Number>
  static void floatingNumber(void* context, Number number) {
    from(context).number(static_cast<double>(number));
  }

  void fail(const char* reason) {
    if (failure_ == nullptr) failure_ = reason;
  }
  Level* innermost() { return depth_ == 0 ? nullptr : &levels_[depth_ - 1]; }
  bool expectsKey() {
    const Level* level = innermost();
    return level != nullptr && level->dictionary != nullptr && level->slot == nullptr;
  }

  Value* place();
  void completed();
  template <typename Content>
  void scalar(Content&& content);
  template <typename Number>
  void number(Number number);
  void negative(uint64_t value);
  void text(std::string_view text);
  void key(std::string_view key);
  void data(std::span<const uint8_t> bytes);
  void beginChunks(Chunks kind);
  void beginContainer(bool isMap, uint64_t count, bool indefinite);
  void tag(uint64_t tag);
  void endIndefinite();

  std::span<const uint8_t> rest_;
  const char* failure_ = nullptr;
  Value root_;
  bool complete_ = false;
  size_t depth_ = 0;
  size_t values_ = 0;
  uint64_t tag_ = 0;  // of the value to come; 0: none
  Chunks chunks_ = Chunks::none;
  std::string textChunks_;
  Value::Data dataChunks_;
  std::array<Level, kMaximumNesting> levels_;  // the first depth_ are set
};

const cbor_callbacks Decoder::kCallbacks = {
    .uint8 = unsignedNumber,
    .uint16 = unsignedNumber,
    .uint32 = unsignedNumber,
    .uint64 = unsignedNumber,
    .negint64 = negativeNumber,
    .negint32 = negativeNumber,
    .negint16 = negativeNumber,
    .negint8 = negativeNumber,
    .byte_string_start = [](void* context) { from(context).beginChunks(Chunks::data); },
    .byte_string = [](void* context, cbor_data bytes,
                      size_t size) { from(context).data({bytes, size}); },
    .string = [](void* context, cbor_data bytes,
                 size_t size) { from(context).text({reinterpret_cast<const char*>(bytes), size}); },
    .string_start = [](void* context) { from(context).beginChunks(Chunks::text); },
    .indef_array_start =
        [](void* context) {
          from(context).beginContainer(/*isMap=*/false, 0, /*indefinite=*/true);
        },
    .array_start =
        [](void* context, size_t count) {
          from(context).beginContainer(/*isMap=*/false, count, /*indefinite=*/false);
        },
    .indef_map_start =
        [](void* context) { from(context).beginContainer(/*isMap=*/true, 0, /*indefinite=*/true); },
    .map_start =
        [](void* context, size_t count) {
          from(context).beginContainer(/*isMap=*/true, count, /*indefinite=*/false);
        },
    .tag = [](void* context, uint64_t tag) { from(context).tag(tag); },
    .float2 = floatingNumber,
    .float4 = floatingNumber,
    .float8 = floatingNumber,
    .undefined = [](void* context) { from(context).fail("an undefined value"); },
    .null = [](void* context) { from(context).scalar(nullptr); },
    .boolean = [](void* context, bool value) { from(context).scalar(value); },
    .indef_break = [](void* context) { from(context).endIndefinite(); },
};

std::expected<Message, CodecError> Decoder::run() {
  while (!complete_ && failure_ == nullptr) {
    const cbor_decoder_result result =
        cbor_stream_decode(rest_.data(), rest_.size(), &kCallbacks, this);
    if (result.status == CBOR_DECODER_NEDATA) fail("the body ends in the middle of a value");
    if (result.status == CBOR_DECODER_ERROR) fail("malformed CBOR");
    rest_ = rest_.subspan(result.read);
  }
  if (failure_ == nullptr && !rest_.empty()) fail("bytes after the end of the body's map");
  Value::Dictionary* values = root_.asDictionary();
  if (failure_ == nullptr && values == nullptr) fail("the body is not a map");
  if (failure_ != nullptr) return std::unexpected(CodecError{failure_});
  return Message(std::move(*values));
}

// Where the value goes that begins now; null when none may stand here.
Value* Decoder::place() {
  if (chunks_ != Chunks::none) fail("a chunk of another type inside a string");
  if (expectsKey()) fail("a key that is not text");
  if (++values_ > kMaximumValues) fail("too many values");
  if (failure_ != nullptr) return nullptr;
  Level* level = innermost();
  if (level == nullptr) return &root_;
  if (level->array != nullptr) return &level->array->emplace_back();
  return std::exchange(level->slot, nullptr);
}

// A value is complete, and with it all that it was the last part of.
void Decoder::completed() {
  for (; depth_ > 0; --depth_) {
    Level& level = levels_[depth_ - 1];
    if (level.indefinite || --level.remaining > 0) return;
  }
  complete_ = true;
}

template <typename Content>
void Decoder::scalar(Content&& content) {
  if (tag_ != 0) fail("a tag over a value of another type");
  Value* target = place();
  if (target == nullptr) return;
  *target = Value(std::forward<Content>(content));
  completed();
}

template <typename Number>
void Decoder::number(Number number) {
  if (tag_ != kDateTag) return scalar(number);
  tag_ = 0;
  scalar(Date{static_cast<double>(number)});
}

void Decoder::negative(uint64_t value) {
  if (value > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) {
    return fail("a negative number below -2^63");
  }
  number(-1 - static_cast<int64_t>(value));
}

void Decoder::text(std::string_view text) {
  if (!isValidText(text)) return fail("text that is not UTF-8 or holds a NUL");
  if (chunks_ == Chunks::text) {
    textChunks_ += text;
  } else if (chunks_ == Chunks::none && expectsKey()) {
    key(text);
  } else {
    scalar(text);
  }
}

void Decoder::key(std::string_view key) {
  if (tag_ != 0) return fail("a tag over a key");
  Level& level = *innermost();
  // Keys mostly come in order, as the encoder writes them; they then go to the end at once.
  const size_t before = level.dictionary->size();
  const auto entry =
      level.dictionary->emplace_hint(level.dictionary->end(), std::string(key), nullptr);
  if (level.dictionary->size() == before) return fail("a duplicate key");
  level.slot = &entry->second;
}

void Decoder::data(std::span<const uint8_t> bytes) {
  if (chunks_ == Chunks::data) {
    dataChunks_.insert(dataChunks_.end(), bytes.begin(), bytes.end());
    return;
  }
  if (tag_ != kUUIDTag) return scalar(Value::Data(bytes.begin(), bytes.end()));
  UUID::Bytes uuid{};
  if (bytes.size() != uuid.size()) return fail("a UUID that is not 16 bytes long");
  std::memcpy(uuid.data(), bytes.data(), uuid.size());
  tag_ = 0;
  scalar(UUID(uuid));
}

void Decoder::beginChunks(Chunks kind) {
  if (chunks_ != Chunks::none) return fail("a string in chunks inside another");
  chunks_ = kind;
}

void Decoder::beginContainer(bool isMap, uint64_t count, bool indefinite) {
  if (tag_ != 0) fail("a tag over an array or a map");
  if (depth_ == kMaximumNesting) fail("nested too deep");
  if (count > rest_.size()) fail("more elements than bytes");
  Value* target = place();
  if (target == nullptr) return;
  Level level = {.array = nullptr,
                 .dictionary = nullptr,
                 .slot = nullptr,
                 .remaining = count,
                 .indefinite = indefinite};
  if (isMap) {
    *target = Value(Value::Dictionary());
    level.dictionary = target->asDictionary();
  } else {
    *target = Value(Value::Array());
    level.array = target->asArray();
    level.array->reserve(std::min<size_t>(count, kMaximumReservation));
  }
  if (count == 0 && !indefinite) return completed();
  levels_[depth_++] = level;
}

void Decoder::tag(uint64_t tag) {
  if (chunks_ != Chunks::none || tag_ != 0) return fail("a misplaced tag");
  if (tag != kDateTag && tag != kUUIDTag) return fail("an unknown tag");
  tag_ = tag;
}

void Decoder::endIndefinite() {
  if (const Chunks kind = std::exchange(chunks_, Chunks::none); kind == Chunks::text) {
    text(std::exchange(textChunks_, {}));
  } else if (kind == Chunks::data) {
    data(std::exchange(dataChunks_, {}));
  } else if (depth_ == 0 || !levels_[depth_ - 1].indefinite ||
             levels_[depth_ - 1].slot != nullptr || tag_ != 0) {
    fail("a misplaced break");
  } else {
    --depth_;
    completed();
  }
}

}  // namespace

std::expected<Message, CodecError> decodeMessage(std::span<const uint8_t> body) {
  return Decoder(body).run();
}

}  // namespace platform::ipc

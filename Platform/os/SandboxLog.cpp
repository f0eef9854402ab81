#include "Platform/os/SandboxLog.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <vector>

#include "Platform/base/WholeNumber.h"
#include "Platform/os/RuntimeDirectory.h"
#include "Platform/os/Sandbox.h"

namespace platform {
namespace {

bool standsForItself(char c) {
  const auto byte = static_cast<unsigned char>(c);
  return byte > 0x20 && byte != 0x7F && c != '%';
}

void appendEncoded(std::string& line, std::string_view text) {
  while (!text.empty()) {
    const auto end = std::ranges::find_if_not(text, standsForItself);
    line.append(text.begin(), end);
    if (end == text.end()) return;
    line += fmt::format("%{:02X}", static_cast<unsigned char>(*end));
    text = {end + 1, text.end()};
  }
}

size_t encodedSize(std::string_view text) {
  return text.size() +
         2 * static_cast<size_t>(std::ranges::count_if(text, std::not_fn(standsForItself)));
}

std::optional<std::string> decoded(std::string_view text) {
  std::string result;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      result += text[i];
      continue;
    }
    if (text.size() - i < 3) return std::nullopt;
    const auto byte = wholeNumber<uint8_t>(text.substr(i + 1, 2), 16);
    if (!byte) return std::nullopt;
    result += static_cast<char>(*byte);
    i += 2;
  }
  return result;
}

// Takes the text up to the next tab, or all of it, out of `line`.
std::optional<std::string_view> takeField(std::optional<std::string_view>& line) {
  if (!line) return std::nullopt;
  const size_t tab = line->find('\t');
  const std::string_view field = line->substr(0, tab);
  line = tab == std::string_view::npos ? std::nullopt : std::optional(line->substr(tab + 1));
  return field;
}

template <typename Number>
std::optional<Number> takeNumber(std::optional<std::string_view>& line) {
  return wholeNumber<Number>(takeField(line).value_or(""));
}

}  // namespace

std::string sandboxLogPath(const FileSystem& files) {
  return runtimeDirectory(files) + "/sandbox/mappings";
}

bool fitsMappingLine(const SandboxMappingKey& key, const std::optional<std::string>& path) {
  constexpr size_t kVerbAndNumbers = 64;  // at most
  return kVerbAndNumbers + encodedSize(key.identifier) + (path ? encodedSize(*path) : 0) <=
         kLongestMappingLine;
}

std::string formatMappingLine(const SandboxMappingKey& key,
                              const std::optional<std::string>& path) {
  std::string line =
      fmt::format("{}\t{}\t{}\t{}\t", path ? "set" : "clear", key.uid, key.personaID, key.itemType);
  line.reserve(line.size() + key.identifier.size() + (path ? path->size() : 0) + 2);
  appendEncoded(line, key.identifier);
  if (path) {
    line += '\t';
    appendEncoded(line, *path);
  }
  line += '\n';
  return line;
}

std::optional<SandboxMapping> parseMappingLine(std::string_view line) {
  std::optional<std::string_view> rest = line;
  const auto verb = takeField(rest);
  const bool isSet = verb == "set";
  if (!isSet && verb != "clear") return std::nullopt;
  const auto uid = takeNumber<uid_t>(rest);
  const auto personaID = takeNumber<int32_t>(rest);
  const auto itemType = takeNumber<uint32_t>(rest);
  if (!uid || !personaID || !itemType || !rest) return std::nullopt;
  auto identifier = decoded(*takeField(rest));
  if (!identifier || rest.has_value() != isSet) return std::nullopt;
  SandboxMapping mapping{*uid, *personaID, *itemType, *std::move(identifier), std::nullopt};
  if (!isSet) return mapping;
  mapping.path = decoded(*takeField(rest));
  if (!mapping.path || rest) return std::nullopt;
  return mapping;
}

Result<void> forEachLine(int descriptor, const std::function<void(std::string_view)>& visit) {
  std::vector<char> block(64 * 1024);
  std::string line;  // what of the current line has been read, while it is not too long
  bool tooLong = false;
  for (;;) {
    const ssize_t count = ::read(descriptor, block.data(), block.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return lastErrno();
    if (count == 0) break;
    std::string_view text(block.data(), static_cast<size_t>(count));
    while (!text.empty()) {
      const size_t end = text.find('\n');
      const std::string_view piece = text.substr(0, end);
      tooLong = tooLong || line.size() + piece.size() > kLongestMappingLine;
      if (!tooLong) line += piece;
      if (end == std::string_view::npos) break;
      visit(tooLong ? std::string_view() : line);
      line.clear();
      tooLong = false;
      text.remove_prefix(end + 1);
    }
  }
  if (!line.empty() || tooLong) visit({});
  return {};
}

}  // namespace platform

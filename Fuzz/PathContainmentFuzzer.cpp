// Random trees of directories, files and links, and random paths into them. What
// realPathForURL:ifChildOfURL: accepts must lie inside the base when the kernel resolves it.
//
// The input is a list of lines. "d PATH" makes a directory, "f PATH" a file, "l PATH TEXT" a link,
// each below the directory "t" of a scratch root; "b PATH" chooses the base; "?TEXT" asks about the
// base with TEXT behind it.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <sstream>
#include <string>

#include "Daemon/TSYFileManager.h"
#include "Fuzz/FuzzDevice.h"

namespace {

constexpr size_t kMostLines = 24;
constexpr size_t kLongestInput = 2048;

std::string treePath(const FuzzDevice& device, const std::string& text) {
  return device.root() + "/t/" + text;
}

std::string kernelPath(const std::string& path) {
  const std::unique_ptr<char, decltype(&std::free)> real(::realpath(path.c_str(), nullptr),
                                                         &std::free);
  return real ? real.get() : "";
}

void makeLink(const FuzzDevice& device, const std::string& path, const std::string& text) {
  const auto place = device.files().locate(path);
  if (!place || text.empty()) return;
  (void)::symlinkat(text.c_str(), place->parent.get(), place->name.c_str());
}

void ask(const std::string& base, const std::string& text) {
  const auto accepted =
      TSYFileManager::defaultManager().realPathForURL(TSYURL(base + text), TSYURL(base));
  if (!accepted) return;
  // What is missing yet must be inside as well: look at the longest part that is there.
  std::string there = accepted->path();
  while (kernelPath(there).empty()) there.resize(there.rfind('/'));
  const std::string real = kernelPath(there);
  const std::string realBase = kernelPath(base);
  const bool isInside = !realBase.empty() && (real == realBase || real.starts_with(realBase + '/'));
  const bool isWithoutLinks = real == there;
  if (isInside && isWithoutLinks) return;
  std::fprintf(stderr, "accepted %s%s as %s: really %s, base %s\n", base.c_str(), text.c_str(),
               accepted->path().c_str(), real.c_str(), realBase.c_str());
  std::abort();
}

void run(const FuzzDevice& device, const std::string& line, std::string& base) {
  if (line.starts_with('?')) return ask(base, line.substr(1));
  if (line.size() < 3 || line[1] != ' ') return;
  const std::string rest = line.substr(2);
  const size_t space = rest.find(' ');
  switch (line[0]) {
    case 'd':
      (void)device.files().makePath(treePath(device, rest), 0755);
      break;
    case 'f':
      (void)device.files().writeFile(treePath(device, rest), {}, {});
      break;
    case 'l':
      if (space != std::string::npos) {
        makeLink(device, treePath(device, rest.substr(0, space)), rest.substr(space + 1));
      }
      break;
    case 'b':
      base = TSYURL(treePath(device, rest)).path();
      break;
    default:
      break;
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
  static const FuzzDevice device;
  if (size > kLongestInput) return 0;
  (void)device.files().makePath(treePath(device, "base"), 0755);
  std::string base = treePath(device, "base");
  std::istringstream input(std::string(reinterpret_cast<const char*>(bytes), size));
  std::string line;
  for (size_t lines = 0; lines < kMostLines && std::getline(input, line); ++lines) {
    run(device, line, base);
  }
  if (!device.files().remove(treePath(device, ""), nullptr)) std::abort();
  return 0;
}

// Whether a path that somebody else has made up really stays inside a directory.
//
// A path may be given with or without the leading "/private" that stands before "/var", "/tmp" and
// "/etc"; the two spellings name the same directory and are compared as one. Cheap checks on the
// text come first. What decides is the last one: both paths are resolved, down to where the
// suspicious one begins to be missing, and then compared component by component. Resolved paths
// have one spelling only, so there nothing is stripped any more.
//
// The answer holds for the moment. It contains no link, so whoever reaches it without following
// links gets what was checked or nothing.
#include <algorithm>
#include <string_view>

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYPropertyList.h"
#include "Platform/os/Platform.h"

namespace {

using platform::Errno;
using platform::FileSystem;

FileSystem& files() {
  return platform::Platform::current().files;
}

// The part of a path below the root of the system.
std::string_view belowRoot(std::string_view path) {
  const std::string& root = files().root();
  if (!path.starts_with(root)) return path;
  const std::string_view below = path.substr(root.size());
  return below.empty() || below.starts_with('/') ? below : path;
}

std::string_view withoutPrivate(std::string_view path) {
  constexpr std::string_view kPrivate = "/private";
  const bool hasPrivate =
      path.starts_with(kPrivate) && path.substr(kPrivate.size()).starts_with('/');
  return hasPrivate ? path.substr(kPrivate.size()) : path;
}

// The components but "/", "." and empty ones.
std::vector<std::string_view> componentsOf(std::string_view path) {
  std::vector<std::string_view> components;
  while (!path.empty()) {
    const size_t end = std::min(path.find('/'), path.size());
    const std::string_view component = path.substr(0, end);
    path.remove_prefix(std::min(end + 1, path.size()));
    if (!component.empty() && component != ".") components.push_back(component);
  }
  return components;
}

// How deep a walk along the components ends when it starts at `depth`; none when it passes below
// `floor` on the way.
std::optional<long> walkedDepth(std::string_view path, long depth, long floor) {
  for (const std::string_view component : componentsOf(path)) {
    depth += component == ".." ? -1 : 1;
    if (depth < floor) return std::nullopt;
  }
  return depth;
}

// Whether the text of a relative link, found at `relativeLink` inside `base`, stays inside.
bool pointsInside(std::string_view base, std::string_view relativeLink, const std::string& target,
                  const TSYURL& suspicious) {
  const auto depth = walkedDepth(base, 0, 0);
  if (!depth) {
    TSYLogWrite(TSYLogLevelError, "Failed to retrieve depth of {}", base);
    return false;
  }
  const size_t lastSlash = relativeLink.rfind('/');
  std::string place(relativeLink.substr(0, lastSlash == std::string_view::npos ? 0 : lastSlash));
  place.append(1, '/').append(target);
  if (walkedDepth(place, *depth, *depth)) return true;
  TSYLogWrite(TSYLogLevelError, "Rejecting {} -> {}, as it is points outside or to the base {}",
              suspicious.path(), target, base);
  return false;
}

// Whether the suspicious path, when it is a link itself, points to where it may.
bool isLinkAcceptable(std::string_view base, std::string_view relativePath,
                      const TSYURL& suspicious, const std::string& canonical) {
  const auto target = files().readLink(canonical);
  if (!target) {
    const Errno error = target.error();
    if (error == Errno{EINVAL} || error == Errno{ENOENT}) return true;
    TSYLogWrite(TSYLogLevelError, "Readlink failed: {}", error.message());
    return false;
  }
  if (target->starts_with('/')) {
    TSYLogWrite(TSYLogLevelError, "Rejecting {} -> {}, as absolute symlinks are not allowed",
                suspicious.path(), *target);
    return false;
  }
  return pointsInside(base, relativePath, *target, suspicious);
}

// Resolves the longest prefix that exists and appends the rest as it is. A link that leads nowhere
// exists: what lies behind it cannot be known, and the path is refused.
std::optional<std::string> realPathAllowingNonExistentComponents(const std::string& path) {
  std::string existing = path;
  std::string missing;
  for (;;) {
    const auto resolved = files().resolve(existing);
    if (resolved) {
      if (missing.empty()) return *resolved;
      TSYLogWrite(TSYLogLevelDebug, "Realpathed {} ; appending non-existing components {}",
                  existing, missing);
      return *resolved == "/" ? missing : *resolved + missing;
    }
    const size_t slash = existing.rfind('/');
    const bool canShorten = slash != std::string::npos && slash > 0;
    const bool isMissing = resolved.error() == Errno{ENOENT} && !files().readLink(existing);
    if (!isMissing || !canShorten) {
      TSYLogWrite(TSYLogLevelError, "Failed to realpath {} : {} at {}", path,
                  resolved.error().message(), existing);
      return std::nullopt;
    }
    const std::string_view component = std::string_view(existing).substr(slash + 1);
    if (!component.empty() && component != ".") missing.insert(0, '/' + std::string(component));
    existing.resize(slash);
  }
}

bool areComponentsInside(const std::string& realBase, const std::string& realSuspicious,
                         const TSYURL& base, const TSYURL& suspicious) {
  const auto baseComponents = componentsOf(belowRoot(realBase));
  const auto components = componentsOf(belowRoot(realSuspicious));
  if (baseComponents.empty() || components.empty()) {
    TSYLogWrite(
        TSYLogLevelError,
        "Rejecting {} with base {} because real component counts don't make sense (reals {} "
        "; {})",
        suspicious.path(), base.path(), realSuspicious, realBase);
    return false;
  }
  if (baseComponents.size() > components.size()) {
    TSYLogWrite(TSYLogLevelError,
                "Rejecting {} with base {} because base component count is greater than child "
                "component count (reals {} ; {})",
                suspicious.path(), base.path(), realSuspicious, realBase);
    return false;
  }
  const auto [inBase, inSuspicious] = std::ranges::mismatch(baseComponents, components);
  if (inBase == baseComponents.end()) return true;
  TSYLogWrite(TSYLogLevelError,
              "Rejecting {} with base {} (reals {} ; {}) because components diverge at {} != {}",
              suspicious.path(), base.path(), realSuspicious, realBase, *inBase, *inSuspicious);
  return false;
}

}  // namespace

std::optional<TSYURL> TSYFileManager::realPathForURL(const TSYURL& suspicious,
                                                     const TSYURL& ifChildOfURL) {
  const TSYURL& base = ifChildOfURL;
  if (suspicious.path().empty() || base.path().empty()) {
    TSYLogWrite(TSYLogLevelError, "The base path {} and/or suspicious path {} were nil",
                base.path(), suspicious.path());
    return std::nullopt;
  }
  const std::string_view suspiciousText = withoutPrivate(belowRoot(suspicious.path()));
  const std::string_view baseText = withoutPrivate(belowRoot(base.path()));
  if (!suspiciousText.starts_with(baseText)) {
    TSYLogWrite(TSYLogLevelError, "supiscious path {} does not contain base path {} as a prefix",
                suspicious.path(), base.path());
    return std::nullopt;
  }
  if (containsDotDotPathComponents(suspiciousText)) {
    TSYLogWrite(TSYLogLevelError, "The suspicious path {} contains '..' paths, which are invalid",
                suspicious.path());
    return std::nullopt;
  }
  // The suspicious path in the spelling of the base.
  const std::string_view relativePath = suspiciousText.substr(baseText.size());
  const std::string canonical = base.path() + std::string(relativePath);
  if (!isLinkAcceptable(baseText, relativePath, suspicious, canonical)) return std::nullopt;

  const auto realBase = files().resolve(base.path());
  if (!realBase) {
    TSYLogWrite(TSYLogLevelError, "Failed to retrieve realpath for base path {} ", base.path());
    return std::nullopt;
  }
  auto realSuspicious = realPathAllowingNonExistentComponents(canonical);
  if (!realSuspicious) {
    TSYLogWrite(TSYLogLevelError, "Failed to retrieve realpath for suspicious path {}",
                suspicious.path());
    return std::nullopt;
  }
  // Counting the components of a link is not enough: one of them may be a link itself, so what a
  // link resolves to is compared like everything else.
  if (!areComponentsInside(*realBase, *realSuspicious, base, suspicious)) return std::nullopt;
  return TSYURL(std::move(*realSuspicious));
}

TSYResult<TSYURL> TSYFileManager::realPathOfItemAtURL(const TSYURL& url) {
  auto resolved = files().resolve(url.path());
  if (resolved) return TSYURL(std::move(*resolved));
  return TSYFailure(TSYPosixErrorCreate(resolved.error(), "realpath of {} failed: {}", url.path(),
                                        resolved.error().message()));
}

TSYURL TSYFileManager::homeDirectoryURLForPOSIXUID(uid_t uid) {
  const auto account = platform::Platform::current().accounts.accountWithUID(uid);
  if (account) {
    const auto home = files().resolve(account->home);
    if (home) return TSYURL(*home);
  } else {
    TSYLogWrite(TSYLogLevelError, "Failed to getpwuid for uid: {}", uid);
  }
  TSYLogWrite(TSYLogLevelError, "Failed to get home dir using getpwuid for uid: {}", uid);
  return TSYURL(files().root() + "/private/var/mobile");
}

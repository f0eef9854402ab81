// A file URL: the absolute path of an item, without a trailing slash.
//
// A plain value. Containers that stay in memory keep (class directory, name) instead; see
// TSYMetadata.
#pragma once

#include <string>
#include <string_view>
#include <utility>

class TSYURL {
 public:
  TSYURL() = default;
  explicit TSYURL(std::string path) : path_(std::move(path)) {
    while (path_.size() > 1 && path_.back() == '/') path_.pop_back();
  }

  const std::string& path() const { return path_; }

  TSYURL appending(std::string_view relativePath) const {
    std::string path;
    path.reserve(path_.size() + 1 + relativePath.size());
    path = path_;
    if (path.empty() || path.back() != '/') path += '/';
    path += relativePath;
    return TSYURL(std::move(path));
  }
  std::string_view lastPathComponent() const {
    return std::string_view(path_).substr(path_.rfind('/') + 1);
  }
  TSYURL deletingLastPathComponent() const {
    const size_t slash = path_.rfind('/');
    return TSYURL(slash == 0 || slash == std::string::npos ? "/" : path_.substr(0, slash));
  }
  // By the text alone: both must be free of dots and links for it to mean anything.
  bool isInside(const TSYURL& directory) const {
    return path_.starts_with(directory.path_) &&
           std::string_view(path_).substr(directory.path_.size()).starts_with('/');
  }

  bool operator==(const TSYURL&) const = default;

 private:
  std::string path_;
};

// Fresh directories for tests, benchmarks and fuzz targets.
#pragma once

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <system_error>

// A new, empty directory in `parent`, by default the one for temporary files: its resolved path.
// Mode 0700. Whoever asks for it removes it. Throws std::system_error.
inline std::string makeScratchDirectory(
    const std::filesystem::path& parent = std::filesystem::temp_directory_path()) {
  constexpr size_t kPlaces = 6;  // that mkdtemp(3) fills
  std::string path =
      std::filesystem::canonical(parent).string() + "/tessary." + std::string(kPlaces, 'X');
  if (::mkdtemp(path.data()) == nullptr) {
    throw std::system_error(errno, std::generic_category(), path);
  }
  return path;
}

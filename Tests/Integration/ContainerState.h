// What creations leave on the disk: whole containers, and litter on its way to removal. For tests
// that interrupt creations.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "Tests/Integration/Device.h"

// One kind of creation request.
struct Creation {
  uint64_t containerClass = 2;
  std::string identifier = "com.example.app";
  bool transient = false;

  // Below the device's root.
  std::string classDirectory() const;
  std::string stagingDirectory() const;
  tessary::Result<tessary::Container> request(tessary::Client& client) const;
  tessary::Result<tessary::Container> lookUp(tessary::Client& client) const;
};

// Every item of a container, "" being itself, with its type, mode, owner, protection class and
// access-control lists.
using Picture = std::map<std::string, std::string>;
Picture pictureOf(const std::string& container);

// What is wrong with the container at `path` of the disk; empty when it is whole, which is: it
// looks like `model`, and its metadata file is valid and its own.
std::string defectOf(const Creation& creation, const std::string& path, const Picture& model);

// A parent for devices that are started again and again: in memory, where fsync costs nothing, when
// there is one with the attributes that containers need. Empty, for the usual place, otherwise.
std::string quickParent();

constexpr char kDeathRow[] = "/private/var/root/Library/Caches/com.veltra.tessaryd/Dead";

// The names in a directory of the device; none when it is not there.
std::vector<std::string> itemsIn(const Device& device, const std::string& directory);

// Starts the daemon and waits until it has thrown away what the one before left behind.
void startAndCleanUp(Device& device);

// Waits until staging and death row are empty; what is still there after some seconds, empty when
// nothing is. `passedOver` begins the names of items in staging that may stay.
std::string litterThatStays(const Device& device, const Creation& creation,
                            const std::string& passedOver = "(none)");

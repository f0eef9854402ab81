// Creation and scanning of containers beside the bare system calls of the same work on the same
// file system, in the same run.
#include <benchmark/benchmark.h>
#include <dirent.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <array>
#include <memory>

#include "Benchmarks/BareWork.h"
#include "Benchmarks/Samples.h"
#include "Benchmarks/Scratch.h"
#include "Platform/values/UUID.h"

namespace {

using platform::FileDescriptor;
using platform::UUID;
using platform::Value;

// What a creation comes to, and nothing else.
void createBare(const std::string& staging, const std::string& live, const Value::Data& bytes) {
  constexpr std::array kSubdirectories = {"Documents",           "Library",    "Library/Caches",
                                          "Library/Preferences", "SystemData", "tmp"};
  const std::string name = UUID::random().string();
  const std::string container = staging + "/" + name;
  const std::string temporary = staging + "/temp_metadata-" + name + ".plist";
  makeOwnedDirectory(container);
  writeSynced(temporary, bytes);
  rename(temporary, container + "/" + kMetadataFile);
  for (const char* subdirectory : kSubdirectories) {
    makeOwnedDirectory(container + "/" + subdirectory);
  }
  rename(container, live + "/" + name);
}

void creation(benchmark::State& state) {
  constexpr int kRounds = 500;
  ScratchDevice device;
  device.start();
  const FileDescriptor socket = device.connect();
  const std::string first = "com.example.creation.0";
  const size_t replySize = roundTripOfFrame(socket.get(), createFrame(first)).size();
  const EchoServer echoServer(createFrame(first).size(), replySize);
  const FileDescriptor bareSocket = echoServer.connect();
  const std::string staging = device.root() + "/bare-staging";
  const std::string live = device.root() + "/bare-live";
  makeOwnedDirectory(staging);
  makeOwnedDirectory(live);
  for (auto _ : state) {
    Samples created;
    Samples bare;
    for (int i = 1; i <= kRounds; ++i) {
      const std::string identifier = fmt::format("com.example.creation.{}", i);
      const std::vector<uint8_t> request = createFrame(identifier);
      created.time([&] { roundTripOfFrame(socket.get(), request); });
      const Value::Data bytes = metadata(identifier);
      bare.time([&] {
        createBare(staging, live, bytes);
        roundTrip(bareSocket.get(), createFrame(first), replySize);
      });
    }
    state.counters["p50_us"] = created.median();
    state.counters["bare_and_echo_p50_us"] = bare.median();
    state.counters["ratio_p50"] = created.median() / bare.median();
  }
}
BENCHMARK(creation)->Iterations(1)->Unit(benchmark::kMillisecond);

constexpr int kContainers = 10'000;

std::string populate(const ScratchDevice& device) {
  const std::string directory = device.root() + "/private/var/mobile/Containers/Data/Application";
  for (int i = 0; i < kContainers; ++i) {
    const std::string container = directory + "/" + UUID::random().string();
    makeOwnedDirectory(container);
    const Value::Data bytes = metadata(fmt::format("com.example.application.{}", i));
    const FileDescriptor file(
        ::open((container + "/" + kMetadataFile).c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    check(::write(file.get(), bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()),
          "cannot write");
  }
  return directory;
}

struct CloseDirectory {
  void operator()(DIR* directory) const { ::closedir(directory); }
};

void scanBare(const std::string& directory) {
  const std::unique_ptr<DIR, CloseDirectory> items(::opendir(directory.c_str()));
  check(items != nullptr, "cannot opendir");
  std::array<char, 4096> buffer{};
  while (const dirent* item = ::readdir(items.get())) {
    if (item->d_name[0] == '.') continue;
    const std::string path = directory + "/" + item->d_name + "/" + kMetadataFile;
    const FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    check(file.valid() && ::read(file.get(), buffer.data(), buffer.size()) > 0, "cannot read");
  }
}

uint64_t memoryOfScan(ScratchDevice& device) {
  device.forgetMappings();
  device.start();
  const FileDescriptor socket = device.connect();
  const uint64_t before = device.daemonMemory();
  roundTripOfFrame(socket.get(), lookupFrame("com.example.first"));
  const uint64_t bytes = device.daemonMemory() - before;
  device.stop();
  return bytes;
}

// The first request after a start scans the class; the page cache is warm for both sides. Memory is
// taken from a start that knows no mapping yet.
void coldScan(benchmark::State& state) {
  constexpr int kRounds = 7;
  ScratchDevice device;
  device.start();
  roundTripOfFrame(device.connect().get(), createFrame("com.example.first"));
  device.stop();
  const std::string directory = populate(device);
  const uint64_t bytes = memoryOfScan(device);
  for (auto _ : state) {
    Samples scans;
    Samples bare;
    for (int i = 0; i < kRounds; ++i) {
      device.start();
      const FileDescriptor socket = device.connect();
      scans.time([&] { roundTripOfFrame(socket.get(), lookupFrame("com.example.first")); });
      device.stop();
      bare.time([&] { scanBare(directory); });
    }
    state.counters["p50_ms"] = scans.median() / 1'000;
    state.counters["bare_p50_ms"] = bare.median() / 1'000;
    state.counters["ratio_p50"] = scans.median() / bare.median();
    state.counters["bytes_per_container"] = static_cast<double>(bytes) / kContainers;
  }
}
BENCHMARK(coldScan)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();

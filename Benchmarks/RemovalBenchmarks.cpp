// Deleting, emptying death row, replacing, measuring and info values, each beside what the system
// does for the same work on the same file system, in the same run.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <array>
#include <filesystem>

#include "Benchmarks/BareWork.h"
#include "Benchmarks/Samples.h"
#include "Benchmarks/Scratch.h"
#include "Client/Client.h"
#include "Platform/values/UUID.h"

namespace {

using platform::UUID;
using platform::Value;
using tessary::Client;
using tessary::Container;
using tessary::ContainerName;

constexpr uint64_t kData = 2;

template <typename T>
T require(tessary::Result<T> result, const char* failure) {
  if (!result) die(fmt::format("{}: {}", failure, result.error().text));
  if constexpr (!std::is_void_v<T>) return std::move(*result);
}

// A device with its daemon and a connection that may do everything.
struct SetUp {
  SetUp() {
    device.start();
    client.emplace(require(Client::connect(device.root()), "cannot connect"));
  }

  Container create(const std::string& identifier, bool transient = false) {
    return require(client->createOrLookup(identifier, kData,
                                          {.createIfNecessary = true, .transient = transient}),
                   "cannot create");
  }

  ScratchDevice device;
  std::optional<Client> client;
};

ContainerName nameOf(const Container& container) {
  return {container.identifier, kData, container.uuid, container.personaUniqueString};
}

// Small files, a hundred to a directory; on disk, so that what follows does not wait for them.
void fill(const std::string& directory, int files) {
  for (int i = 0; i < files; ++i) {
    const std::string below = fmt::format("{}/{}", directory, i / 100);
    if (i % 100 == 0) std::filesystem::create_directories(below);
    const platform::FileDescriptor file(
        ::open(fmt::format("{}/{}", below, i).c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    check(::write(file.get(), "content", 7) == 7, "cannot write");
  }
  ::sync();
}

void runProgram(const std::string& command) {
  check(std::system((command + " >/dev/null").c_str()) == 0, "cannot run a program");
}

// The reply to a deletion must not depend on the size of what goes.
void deletion(benchmark::State& state) {
  constexpr int kRounds = 2;
  constexpr std::array kFiles = {10, 100'000};
  SetUp setUp;
  for (auto _ : state) {
    std::array<Samples, kFiles.size()> taken;
    for (int round = 0; round < kRounds; ++round) {
      for (size_t which = 0; which < kFiles.size(); ++which) {
        fill(setUp.create("com.example.app").path + "/Documents", kFiles[which]);
        taken[which].time([&] {
          require(setUp.client->deleteContainer("com.example.app", kData), "cannot delete");
        });
        require(setUp.client->emptyDeathRow(), "cannot empty");
      }
    }
    state.counters["of_10_p50_us"] = taken[0].median();
    state.counters["of_100k_p50_us"] = taken[1].median();
    state.counters["ratio_p50"] = taken[1].median() / taken[0].median();
  }
}
BENCHMARK(deletion)->Iterations(1)->Unit(benchmark::kMillisecond);

void emptying(benchmark::State& state) {
  constexpr int kRounds = 5;
  constexpr int kFiles = 5'000;
  SetUp setUp;
  const std::string bareTree = setUp.device.root() + "/bare";
  for (auto _ : state) {
    Samples emptied;
    Samples bare;
    for (int round = 0; round < kRounds; ++round) {
      fill(setUp.create("com.example.app").path + "/Documents", kFiles);
      require(setUp.client->deleteContainer("com.example.app", kData), "cannot delete");
      emptied.time([&] { require(setUp.client->emptyDeathRow(), "cannot empty"); });
      fill(bareTree, kFiles);
      bare.time([&] { runProgram("rm -rf " + bareTree); });
    }
    state.counters["p50_ms"] = emptied.median() / 1'000;
    state.counters["rm_p50_ms"] = bare.median() / 1'000;
    state.counters["ratio_p50"] = emptied.median() / bare.median();
  }
}
BENCHMARK(emptying)->Iterations(1)->Unit(benchmark::kMillisecond);

// The renames and writes of a replace: the journal, the old one aside, the new one in its place,
// both leftovers to where they are deleted.
void replaceBare(const std::string& base, const std::string& old, const std::string& replacement) {
  const std::string journal = base + "/journals/" + UUID::random().string();
  const std::string staged = base + "/staging/" + UUID::random().string();
  const std::string dead = base + "/dead/" + UUID::random().string();
  writeSynced(journal + ".tmp", Value::Data(300, 'x'));
  rename(journal + ".tmp", journal);
  syncDirectory(base + "/journals");
  rename(old, staged);
  rename(replacement, old);
  syncDirectory(base);
  makeOwnedDirectory(dead);
  rename(staged, dead + "/old");
  rename(journal, dead + "/journal");
}

void replacing(benchmark::State& state) {
  constexpr int kRounds = 300;
  SetUp setUp;
  const std::string base = setUp.device.root() + "/bare";
  for (const char* name : {"", "/journals", "/staging", "/dead"}) makeOwnedDirectory(base + name);
  makeOwnedDirectory(base + "/old");
  ContainerName old = nameOf(setUp.create("com.example.app"));
  for (auto _ : state) {
    Samples replaced;
    Samples bare;
    for (int round = 0; round < kRounds; ++round) {
      const ContainerName replacement = nameOf(setUp.create("com.example.app", /*transient=*/true));
      replaced.time(
          [&] { require(setUp.client->replaceContainer(old, replacement), "cannot replace"); });
      old = replacement;
      makeOwnedDirectory(base + "/new");
      bare.time([&] { replaceBare(base, base + "/old", base + "/new"); });
    }
    state.counters["p50_us"] = replaced.median();
    state.counters["bare_p50_us"] = bare.median();
    state.counters["ratio_p50"] = replaced.median() / bare.median();
  }
}
BENCHMARK(replacing)->Iterations(1)->Unit(benchmark::kMillisecond);

void diskUsage(benchmark::State& state) {
  constexpr int kRounds = 15;
  constexpr int kFiles = 5'000;
  SetUp setUp;
  const Container container = setUp.create("com.example.app");
  fill(container.path + "/Documents", kFiles);
  for (auto _ : state) {
    Samples measured;
    Samples bare;
    for (int round = 0; round < kRounds; ++round) {
      measured.time([&] { require(setUp.client->diskUsage(nameOf(container)), "cannot measure"); });
      bare.time([&] { runProgram("du -s " + container.path); });
    }
    state.counters["p50_ms"] = measured.median() / 1'000;
    state.counters["du_p50_ms"] = bare.median() / 1'000;
    state.counters["ratio_p50"] = measured.median() / bare.median();
  }
}
BENCHMARK(diskUsage)->Iterations(1)->Unit(benchmark::kMillisecond);

void infoValue(benchmark::State& state) {
  constexpr int kRounds = 500;
  SetUp setUp;
  const ContainerName name = nameOf(setUp.create("com.example.app"));
  const std::string base = setUp.device.root() + "/bare";
  makeOwnedDirectory(base);
  for (auto _ : state) {
    Samples set;
    Samples bare;
    for (int round = 0; round < kRounds; ++round) {
      set.time([&] {
        require(setUp.client->setInfoValue(name, "key", Value(round)), "cannot set a value");
      });
      const Value::Data bytes = metadata("com.example.app");
      bare.time([&] {
        writeSynced(base + "/temporary", bytes);
        rename(base + "/temporary", base + "/metadata");
      });
    }
    state.counters["p50_us"] = set.median();
    state.counters["bare_p50_us"] = bare.median();
    state.counters["ratio_p50"] = set.median() / bare.median();
  }
}
BENCHMARK(infoValue)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace

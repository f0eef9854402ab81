// Requests beside a bare echo server on the same kind of socket, in turns, so that a drift of the
// machine's speed meets both.
#include <benchmark/benchmark.h>
#include <fmt/format.h>
#include <sched.h>

#include <atomic>
#include <memory>
#include <thread>

#include "Benchmarks/Samples.h"
#include "Benchmarks/Scratch.h"
#include "Client/Client.h"

namespace {

using Clock = std::chrono::steady_clock;

// One container that is there, so many identifiers with code-signing information, and an echo
// server for frames of the size of the container's lookup.
struct LookupSetUp {
  explicit LookupSetUp(int registered = 0) {
    device.start();
    registerIdentifiers(registered);
    const platform::FileDescriptor socket = device.connect();
    roundTripOfFrame(socket.get(), createFrame("com.example.application"));
    request = lookupFrame("com.example.application");
    replySize = roundTripOfFrame(socket.get(), request).size();
    echo = std::make_unique<EchoServer>(request.size(), replySize);
  }

  void registerIdentifiers(int count) const {
    auto client = tessary::Client::connect(device.root());
    for (int i = 0; client && i < count; ++i) {
      const auto done = client->registerCodeSigningInfo(
          fmt::format("com.example.registered{}", i),
          platform::Value::Dictionary{{tessary::kEntitlementsKey,
                                       platform::Value::Dictionary{{"com.example.right", true}}}});
      if (!done) die(done.error().text);
    }
  }

  ScratchDevice device;
  std::vector<uint8_t> request;
  size_t replySize = 0;
  std::unique_ptr<EchoServer> echo;
};

// Keeps this process, and those that it starts, on the first processor while it is there: where the
// scheduler wakes a server otherwise decides more than the server.
class OneProcessor {
 public:
  OneProcessor() {
    ::sched_getaffinity(0, sizeof before_, &before_);
    cpu_set_t first;
    CPU_ZERO(&first);
    CPU_SET(0, &first);
    ::sched_setaffinity(0, sizeof first, &first);
  }
  ~OneProcessor() { ::sched_setaffinity(0, sizeof before_, &before_); }
  OneProcessor(const OneProcessor&) = delete;
  OneProcessor& operator=(const OneProcessor&) = delete;

 private:
  cpu_set_t before_;
};

// In turns of one round trip each server finds the processor's caches as the other one left them;
// in longer ones it finds its own.
void lookupRoundTrip(benchmark::State& state) {
  const OneProcessor processor;
  constexpr int kRoundTrips = 20'000;
  const auto roundTripsPerTurn = static_cast<int>(state.range(0));
  constexpr int kRegistered = 10'000;
  const LookupSetUp setUp(kRegistered);
  const platform::FileDescriptor daemon = setUp.device.connect();
  const platform::FileDescriptor bare = setUp.echo->connect();
  for (auto _ : state) {
    Samples lookups;
    Samples echoes;
    const auto takeTurn = [&](Samples& samples, const platform::FileDescriptor& server) {
      for (int i = 0; i < roundTripsPerTurn; ++i) {
        samples.time([&] { roundTrip(server.get(), setUp.request, setUp.replySize); });
      }
    };
    for (int i = 0; i < kRoundTrips / roundTripsPerTurn; ++i) {
      takeTurn(lookups, daemon);
      takeTurn(echoes, bare);
    }
    state.counters["p50_us"] = lookups.median();
    state.counters["p99_us"] = lookups.percentile(0.99);
    state.counters["echo_p50_us"] = echoes.median();
    state.counters["echo_p99_us"] = echoes.percentile(0.99);
    state.counters["ratio_p50"] = lookups.median() / echoes.median();
  }
}
BENCHMARK(lookupRoundTrip)->Arg(1)->Arg(100)->Iterations(1)->Unit(benchmark::kMillisecond);

// Requests per second of so many clients, each with a connection and a thread of his own.
template <typename Connect>
double throughput(const LookupSetUp& setUp, int clients, Connect&& connect) {
  constexpr std::chrono::milliseconds kDuration{1'000};
  std::atomic<bool> over = false;
  std::atomic<uint64_t> total = 0;
  std::vector<std::thread> threads;
  threads.reserve(static_cast<size_t>(clients));
  const auto start = Clock::now();
  for (int i = 0; i < clients; ++i) {
    threads.emplace_back([&, socket = connect()] {
      uint64_t count = 0;
      for (; !over; ++count) roundTrip(socket.get(), setUp.request, setUp.replySize);
      total += count;
    });
  }
  std::this_thread::sleep_for(kDuration);
  over = true;
  for (std::thread& thread : threads) thread.join();
  const std::chrono::duration<double> taken = Clock::now() - start;
  return static_cast<double>(total) / taken.count();
}

void requestsPerSecond(benchmark::State& state) {
  constexpr int kRounds = 3;
  const int clients = static_cast<int>(state.range(0));
  const LookupSetUp setUp;
  for (auto _ : state) {
    double daemon = 0;
    double bare = 0;
    for (int i = 0; i < kRounds; ++i) {
      daemon += throughput(setUp, clients, [&] { return setUp.device.connect(); }) / kRounds;
      bare += throughput(setUp, clients, [&] { return setUp.echo->connect(); }) / kRounds;
    }
    state.counters["per_s"] = daemon;
    state.counters["echo_per_s"] = bare;
    state.counters["ratio"] = daemon / bare;
  }
}
BENCHMARK(requestsPerSecond)->Arg(1)->Arg(8)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace

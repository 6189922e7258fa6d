// D-Bus round trips through zlkad against zlka-devserver on loopback, and the daemon's memory.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <future>
#include <memory>
#include <vector>

#include "client/zlka_client.h"
#include "service/daemon_harness.h"

namespace {

struct Stack {
  service_test::Harness harness;
  std::unique_ptr<zlka_client::ZLKAClient> client;
  bool ready = false;
  Stack() {
    harness.writeManifest("bench", std::filesystem::read_symlink("/proc/self/exe").string(),
                          platform::Value(platform::Array{"token-auth"}));
    if (!harness.startDaemon({"--log-level", "error"})) {
      std::fprintf(stderr, "zlkad did not start:\n%s\n", harness.daemon() ? harness.daemon()->standardError().c_str() : "");
      return;
    }
    auto made = zlka_client::ZLKAClient::connect({.bus = harness.busAddress()});
    if (!made.ok()) return;
    client = std::move(made).value();
    auto opened = client->confirmActivation({.token = service_test::sampleToken(), .uuid = "U"});  // opens the session
    ready = opened.ok();
    if (!ready) std::fprintf(stderr, "first call failed: %s\n%s\n", opened.error().description().c_str(),
                             harness.daemon()->standardError().c_str());
  }
};

Stack& stack() {
  static Stack s;
  return s;
}

uint64_t daemonKiB(const char* field) {
  std::ifstream in("/proc/" + std::to_string(stack().harness.daemon()->pid()) + "/status");
  std::string line;
  while (std::getline(in, line))
    if (line.rfind(field, 0) == 0) return std::stoull(line.substr(std::string(field).size()));
  return 0;
}

template <class Call>
void roundTrips(benchmark::State& state, Call call) {
  if (!stack().ready) return state.SkipWithError("the daemon did not start");
  std::vector<double> micros;
  for (auto _ : state) {
    auto start = std::chrono::steady_clock::now();
    if (!call(*stack().client)) return state.SkipWithError("an operation failed");
    micros.push_back(std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start).count());
  }
  std::sort(micros.begin(), micros.end());
  auto pct = [&](double p) { return micros.empty() ? 0.0 : micros[std::min(micros.size() - 1, size_t(p * micros.size()))]; };
  state.counters["p50_us"] = pct(0.50);
  state.counters["p90_us"] = pct(0.90);
  state.counters["p99_us"] = pct(0.99);
  state.counters["ops_per_second"] = benchmark::Counter(double(state.iterations()), benchmark::Counter::kIsRate);
}

void BM_DBusMetadata(benchmark::State& state) {
  roundTrips(state, [](zlka_client::ZLKAClient& c) {
    return c.requestMetadata({.token = service_test::sampleToken(), .uuid = "U", .requestedLocale = "en_US"}).ok();
  });
}
void BM_DBusActivation(benchmark::State& state) {
  roundTrips(state, [](zlka_client::ZLKAClient& c) { return c.requestActivation({.token = service_test::sampleToken(), .uuid = "U"}).ok(); });
}
void BM_DBusConfirmation(benchmark::State& state) {
  roundTrips(state, [](zlka_client::ZLKAClient& c) { return c.confirmActivation({.token = service_test::sampleToken(), .uuid = "U"}).ok(); });
}

// Resident memory of the daemon after start-up, and its high-water mark while 64 clients, each on
// its own connection, have a call in flight at once.
void BM_DaemonMemory(benchmark::State& state) {
  if (!stack().ready) return state.SkipWithError("the daemon did not start");
  uint64_t idle = daemonKiB("VmRSS:");
  for (auto _ : state) {
    std::vector<std::unique_ptr<zlka_client::ZLKAClient>> clients;
    for (int i = 0; i < 64; ++i) {
      auto made = zlka_client::ZLKAClient::connect({.bus = stack().harness.busAddress()});
      if (!made.ok()) return state.SkipWithError("no bus");
      clients.push_back(std::move(made).value());
    }
    std::vector<std::promise<bool>> done(clients.size());
    for (size_t i = 0; i < clients.size(); ++i)
      clients[i]->requestActivationAsync({.token = service_test::sampleToken(), .uuid = "U"},
                                         [&done, i](auto r) { done[i].set_value(r.ok()); });
    for (auto& d : done)
      if (!d.get_future().get()) return state.SkipWithError("an operation failed");
  }
  state.counters["rss_idle_KiB"] = double(idle);
  state.counters["rss_peak_64_clients_KiB"] = double(daemonKiB("VmHWM:"));
  state.counters["rss_after_KiB"] = double(daemonKiB("VmRSS:"));
}

BENCHMARK(BM_DBusMetadata)->UseRealTime();
BENCHMARK(BM_DBusActivation)->UseRealTime();
BENCHMARK(BM_DBusConfirmation)->UseRealTime();
BENCHMARK(BM_DaemonMemory)->UseRealTime()->Iterations(3);

}  // namespace

BENCHMARK_MAIN();

// zlkad through D-Bus against zlka-devserver on loopback, each figure beside its floor measured in
// the same run:
// - the D-Bus floor: org.freedesktop.DBus.Peer.Ping to zlkad through the same bus;
// - the HTTPS floor: the same signed POSTs made with bare libcurl on one reused connection;
// - each operation's p50/p99 and its p50 as a multiple of the two floors' p50s added up;
// - throughput with 1, 8, 64 and 256 concurrent clients beside the floors' at the same concurrency;
// - zlkad's threads and unique memory (Private_Clean + Private_Dirty) idle, under 64 clients, and
//   with 1,000 idle peers that have each called once (and a new caller still answered).
#include <benchmark/benchmark.h>
#include <sys/resource.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>
#include <thread>
#include <vector>

#include "../network/curl_device.h"
#include "client/zlka_client.h"
#include "platform/bus/handles.h"
#include "platform/values/base64.h"
#include "service/daemon_harness.h"
#include "tarvexsap/tarvex_sap.h"

namespace {

using Clock = std::chrono::steady_clock;
constexpr char kName[] = "com.kestro.ZLKAuthentication.ZLKANetwork";
constexpr char kPath[] = "/com/kestro/ZLKAuthentication/ZLKANetwork";
constexpr char kInterface[] = "com.kestro.ZLKAuthentication.ZLKANetworkProtocol";
constexpr char kUUID[] = "3F2504E0-4F89-11D3-9A0C-0305E82C3301";

enum class Operation { metadata, activation, confirmation };

struct Stack {
  service_test::Harness harness;
  std::string trustAnchor;
  bool ready = false;
  Stack() {
    harness.writeManifest("bench", std::filesystem::read_symlink("/proc/self/exe").string(),
                          platform::Value(platform::Array{"token-auth"}));
    if (!harness.startDaemon({"--log-level", "error"})) {
      std::fprintf(stderr, "zlkad did not start:\n%s\n",
                   harness.daemon() ? harness.daemon()->standardError().c_str() : "");
      return;
    }
    std::ifstream in(harness.stateDirectory() / "sap-root.pem", std::ios::binary);
    trustAnchor.assign(std::istreambuf_iterator<char>(in), {});
    TarvexSAPConfig sap{reinterpret_cast<const uint8_t*>(trustAnchor.data()), trustAnchor.size(), nullptr};
    auto client = zlka_client::ZLKAClient::connect({.bus = harness.busAddress()});
    ready = TarvexSAPConfigure(&sap) == 0 && client.ok() &&
            client.value()
                ->confirmActivation({.token = service_test::sampleToken(), .uuid = kUUID})
                .ok();  // opens the session
  }
};

Stack& stack() {
  static Stack s;
  return s;
}

pid_t daemonPid() { return stack().harness.daemon()->pid(); }

size_t daemonThreads() {
  auto tasks = std::filesystem::directory_iterator("/proc/" + std::to_string(daemonPid()) + "/task");
  return static_cast<size_t>(std::distance(begin(tasks), end(tasks)));
}

// Memory that is the daemon's alone: what a second instance would add.
double daemonUniqueKiB() {
  std::ifstream in("/proc/" + std::to_string(daemonPid()) + "/smaps_rollup");
  double kib = 0;
  for (std::string line; std::getline(in, line);)
    if (line.starts_with("Private_Clean:") || line.starts_with("Private_Dirty:"))
      kib += std::stod(line.substr(line.find(':') + 1));
  return kib;
}

struct Percentiles {
  double p50 = 0, p99 = 0;
};
Percentiles percentiles(std::vector<double> samples) {
  if (samples.empty()) return {};
  std::sort(samples.begin(), samples.end());
  auto at = [&](double q) {
    return samples[std::min(samples.size() - 1, static_cast<size_t>(q * double(samples.size())))];
  };
  return {at(0.50), at(0.99)};
}

std::map<std::string, Percentiles> gFloor;  // "dbus", and each endpoint
std::map<int, double> gFloorRate;           // clients -> operations per second

const char* endpointOf(Operation op) {
  return op == Operation::metadata     ? "queryProductPlan"
         : op == Operation::activation ? "activateAccessory"
                                       : "ackAccessory";
}

// The body zlkad sends for the operation, byte for byte.
std::string bodyOf(Operation op) {
  nlohmann::json body{{"tokens", {platform::base64Encode(service_test::sampleToken().span())}}, {"uuid", kUUID}};
  if (op == Operation::metadata) body["locale"] = "en_US";
  return body.dump();
}

platform::BusPtr connectRaw() {
  sd_bus* bus = nullptr;
  if (sd_bus_new(&bus) < 0) return nullptr;
  platform::BusPtr owned(bus);
  if (sd_bus_set_address(bus, stack().harness.busAddress().c_str()) < 0 || sd_bus_set_bus_client(bus, 1) < 0 ||
      sd_bus_start(bus) < 0)
    return nullptr;
  return owned;
}

bool ping(sd_bus* bus) {
  return sd_bus_call_method(bus, kName, kPath, "org.freedesktop.DBus.Peer", "Ping", nullptr, nullptr, "") >= 0;
}

template <class R>
bool succeeded(const R& result) {
  if (!result.ok()) std::fprintf(stderr, "bench_service: %s\n", result.error().description().c_str());
  return result.ok();
}

bool call(zlka_client::ZLKAClient& client, Operation op) {
  switch (op) {
    case Operation::metadata:
      return succeeded(
          client.requestMetadata({.token = service_test::sampleToken(), .uuid = kUUID, .requestedLocale = "en_US"}));
    case Operation::activation:
      return succeeded(client.requestActivation({.token = service_test::sampleToken(), .uuid = kUUID}));
    case Operation::confirmation:
      return succeeded(client.confirmActivation({.token = service_test::sampleToken(), .uuid = kUUID}));
  }
  return false;
}

template <class Step>
void timed(benchmark::State& state, const std::string& floorKey, Step step) {
  if (!stack().ready) return state.SkipWithError("the daemon did not start");
  std::vector<double> micros;
  for (auto _ : state) {
    auto start = Clock::now();
    if (!step()) return state.SkipWithError("a round trip failed");
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  Percentiles p = percentiles(std::move(micros));
  state.counters["p50_us"] = p.p50;
  state.counters["p99_us"] = p.p99;
  if (!floorKey.empty()) gFloor[floorKey] = p;
}

void BM_FloorDBusPing(benchmark::State& state) {
  platform::BusPtr bus = connectRaw();
  timed(state, "dbus", [&] { return bus && ping(bus.get()); });
}

void BM_FloorHTTPS(benchmark::State& state, Operation op) {
  netbench::CurlDevice device(stack().harness.server().baseURL(), stack().harness.stateDirectory() / "ca.pem");
  device.associate();
  const std::string body = bodyOf(op);
  netbench::CurlAnswer answer;
  timed(state, endpointOf(op), [&] { return device.post(endpointOf(op), body, answer); });
}

void BM_Operation(benchmark::State& state, Operation op) {
  auto client = zlka_client::ZLKAClient::connect({.bus = stack().harness.busAddress()});
  if (!client.ok()) return state.SkipWithError("no bus");
  timed(state, "", [&] { return call(*client.value(), op); });
  double floor = gFloor["dbus"].p50 + gFloor[endpointOf(op)].p50;
  if (floor > 0) state.counters["p50_over_floor"] = state.counters["p50_us"] / floor;
}

// The confirmation made with a bare sd-bus call: what the client library adds.
void BM_OperationBare(benchmark::State& state) {
  platform::BusPtr bus = connectRaw();
  const platform::Data token = service_test::sampleToken();
  timed(state, "", [&] {
    sd_bus_message* m = nullptr;
    if (!bus ||
        sd_bus_message_new_method_call(bus.get(), &m, kName, kPath, kInterface, "ConfirmActivationForToken") < 0)
      return false;
    platform::BusMessagePtr call(m);
    int r = sd_bus_message_open_container(m, 'a', "{sv}");
    r = r < 0 ? r : sd_bus_message_open_container(m, 'e', "sv");
    r = r < 0 ? r : sd_bus_message_append(m, "s", "token");
    r = r < 0 ? r : sd_bus_message_open_container(m, 'v', "ay");
    r = r < 0 ? r : sd_bus_message_append_array(m, 'y', token.bytes(), token.length());
    r = r < 0 ? r : sd_bus_message_close_container(m);
    r = r < 0 ? r : sd_bus_message_close_container(m);
    r = r < 0 ? r : sd_bus_message_append(m, "{sv}", "uuid", "s", kUUID);
    r = r < 0 ? r : sd_bus_message_close_container(m);
    sd_bus_message* reply = nullptr;
    r = r < 0 ? r : sd_bus_call(bus.get(), m, 0, nullptr, &reply);
    platform::BusMessagePtr owned(reply);
    return r >= 0;
  });
}

// Operations per second with `clients` callers each on a connection of its own, calling in a loop
// for a fixed time; the floor does the same with a Ping and a bare signed POST per operation.
// Failed calls are counted in `failures` (none given: the first one ends the run with -1).
template <class Worker>
double rate(int clients, std::chrono::milliseconds duration, Worker makeWorker, std::atomic<long>* failures = nullptr) {
  using Step = decltype(makeWorker());
  std::vector<Step> steps;
  for (int i = 0; i < clients; ++i) steps.push_back(makeWorker());
  std::atomic<long> done{0};
  std::atomic<bool> failed{false};
  const auto stop = Clock::now() + duration;
  {
    std::vector<std::jthread> threads;
    for (Step& step : steps)
      threads.emplace_back([&] {
        while (Clock::now() < stop && !failed)
          if (step())
            ++done;
          else if (failures)
            ++*failures;
          else
            failed = true;
      });
  }
  return failed ? -1 : double(done) / std::chrono::duration<double>(duration).count();
}

// The floor's callers share at most as many HTTPS connections as zlkad keeps to one server (32):
// the reference server, like any, cannot hold one per caller at 256.
class DevicePool {
 public:
  explicit DevicePool(int size) {
    for (int i = 0; i < size; ++i) {
      free_.push_back(std::make_unique<netbench::CurlDevice>(stack().harness.server().baseURL(),
                                                             stack().harness.stateDirectory() / "ca.pem"));
      free_.back()->associate();
    }
  }
  bool post(const std::string& endpoint, const std::string& body) {
    std::unique_ptr<netbench::CurlDevice> device;
    {
      std::unique_lock lock(mutex_);
      returned_.wait(lock, [&] { return !free_.empty(); });
      device = std::move(free_.back());
      free_.pop_back();
    }
    netbench::CurlAnswer answer;
    bool ok = device->post(endpoint, body, answer);
    {
      std::lock_guard lock(mutex_);
      free_.push_back(std::move(device));
    }
    returned_.notify_one();
    return ok;
  }

 private:
  std::mutex mutex_;
  std::condition_variable returned_;
  std::vector<std::unique_ptr<netbench::CurlDevice>> free_;
};

void BM_ThroughputFloor(benchmark::State& state) {
  if (!stack().ready) return state.SkipWithError("the daemon did not start");
  const int clients = static_cast<int>(state.range(0));
  auto devices = std::make_shared<DevicePool>(std::min(clients, 32));
  const std::string body = bodyOf(Operation::confirmation);
  double perSecond = 0;
  for (auto _ : state)
    perSecond = rate(clients, std::chrono::milliseconds(1500), [&] {
      auto bus = std::make_shared<platform::BusPtr>(connectRaw());
      return [bus, devices, &body] { return *bus && ping(bus->get()) && devices->post("ackAccessory", body); };
    });
  if (perSecond < 0) return state.SkipWithError("a floor operation failed");
  gFloorRate[clients] = perSecond;
  state.counters["ops_per_second"] = perSecond;
}

void BM_Throughput(benchmark::State& state) {
  if (!stack().ready) return state.SkipWithError("the daemon did not start");
  const int clients = static_cast<int>(state.range(0));
  double perSecond = 0;
  std::atomic<size_t> peakThreads{0};
  std::atomic<bool> measuring{true};
  std::jthread sampler([&] {
    while (measuring) {
      peakThreads = std::max(peakThreads.load(), daemonThreads());
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
  });
  std::atomic<long> failures{0};
  auto connections = [] { return stack().harness.server().statistics()["connections"].get<double>(); };
  const double connectionsBefore = connections();
  for (auto _ : state)
    perSecond = rate(
        clients, std::chrono::milliseconds(1500),
        [&] {
          auto client = std::shared_ptr<zlka_client::ZLKAClient>(
              zlka_client::ZLKAClient::connect({.bus = stack().harness.busAddress()}).value().release());
          return [client] { return call(*client, Operation::confirmation); };
        },
        &failures);
  measuring = false;
  state.counters["ops_per_second"] = perSecond;
  state.counters["failed_calls"] = double(failures.load());
  // The TLS connections the server accepted during the run: once warm, the daemon reuses them.
  state.counters["new_connections"] = connections() - connectionsBefore;
  if (gFloorRate.count(clients)) state.counters["over_floor"] = perSecond / gFloorRate[clients];
  state.counters["daemon_threads_peak"] = double(peakThreads.load());
  if (clients == 64) state.counters["unique_KiB_after_64"] = daemonUniqueKiB();
}

// Idle is measured first thing and again once the pools have shed the workers that load added
// (they end after 5 s without work).
void BM_Idle(benchmark::State& state) {
  if (!stack().ready) return state.SkipWithError("the daemon did not start");
  for (auto _ : state) std::this_thread::sleep_for(std::chrono::milliseconds(state.range(0)));
  state.counters["idle_threads"] = double(daemonThreads());
  state.counters["idle_unique_KiB"] = daemonUniqueKiB();
}

void BM_Resources(benchmark::State& state) {
  if (!stack().ready) return state.SkipWithError("the daemon did not start");
  for (auto _ : state) {
    // A thousand peers that have each called once and stay connected.
    std::vector<platform::BusPtr> peers;
    for (int i = 0; i < 1000; ++i) {
      platform::BusPtr peer = connectRaw();
      if (!peer) return state.SkipWithError("cannot connect 1,000 peers");
      sd_bus_message* answer = nullptr;
      if (sd_bus_call_method(peer.get(), kName, kPath, kInterface, "ConfirmActivationForToken", nullptr, &answer,
                             "a{sv}", 2, "token", "ay", 2, 0x30, 0x00, "uuid", "s", kUUID) < 0)
        return state.SkipWithError("a peer's call was not answered");
      sd_bus_message_unref(answer);
      peers.push_back(std::move(peer));
    }
    state.counters["threads_1000_peers"] = double(daemonThreads());
    state.counters["unique_KiB_1000_peers"] = daemonUniqueKiB();
    auto newcomer = zlka_client::ZLKAClient::connect({.bus = stack().harness.busAddress()});
    state.counters["new_caller_answered"] = newcomer.ok() && call(*newcomer.value(), Operation::confirmation);
  }
}

// A greedy peer sends thousands of calls and reads none of the answers while another caller calls
// one at a time: that caller's latency beside its own unloaded p50, the daemon's unique memory at
// the peak and once the greedy calls are done, and an oversize token refused without growth.
void BM_GreedyPeer(benchmark::State& state) {
  if (!stack().ready) return state.SkipWithError("the daemon did not start");
  const int greedyCalls = static_cast<int>(state.range(0));
  auto other = zlka_client::ZLKAClient::connect({.bus = stack().harness.busAddress()});
  platform::BusPtr greedy = connectRaw();
  if (!other.ok() || !greedy) return state.SkipWithError("no bus");
  std::vector<double> alone, loaded;
  auto timedCall = [&](std::vector<double>& into) {
    auto start = Clock::now();
    bool ok = call(*other.value(), Operation::confirmation);
    into.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    return ok;
  };
  for (int i = 0; i < 50; ++i) timedCall(alone);
  const double before = daemonUniqueKiB();
  double peak = before;
  for (auto _ : state) {
    for (int i = 0; i < greedyCalls; ++i)
      sd_bus_call_method_async(greedy.get(), nullptr, kName, kPath, kInterface, "ConfirmActivationForToken", nullptr,
                               nullptr, "a{sv}", 2, "token", "ay", 2, 0x30, 0x00, "uuid", "s", kUUID);
    sd_bus_flush(greedy.get());
    for (int i = 0; i < 50; ++i) {
      if (!timedCall(loaded)) return state.SkipWithError("the other caller's call failed");
      peak = std::max(peak, daemonUniqueKiB());
    }
  }
  greedy.reset();  // the greedy peer leaves; its waiting calls end with it
  std::this_thread::sleep_for(std::chrono::seconds(6));
  state.counters["other_p50_alone_us"] = percentiles(alone).p50;
  state.counters["other_p50_loaded_us"] = percentiles(loaded).p50;
  state.counters["other_p99_loaded_us"] = percentiles(loaded).p99;
  state.counters["other_p99_over_alone_p50"] = percentiles(loaded).p99 / percentiles(alone).p50;
  state.counters["unique_KiB_before"] = before;
  state.counters["unique_KiB_peak"] = peak;
  state.counters["unique_KiB_after"] = daemonUniqueKiB();
  // 16 MiB of token: refused with InvalidArgs before any work on it.
  platform::BusPtr big = connectRaw();
  std::vector<uint8_t> token(16u << 20, 0);
  sd_bus_message* m = nullptr;
  sd_bus_message_new_method_call(big.get(), &m, kName, kPath, kInterface, "ConfirmActivationForToken");
  platform::BusMessagePtr message(m);
  sd_bus_message_open_container(m, 'a', "{sv}");
  sd_bus_message_open_container(m, 'e', "sv");
  sd_bus_message_append(m, "s", "token");
  sd_bus_message_open_container(m, 'v', "ay");
  sd_bus_message_append_array(m, 'y', token.data(), token.size());
  sd_bus_message_close_container(m);
  sd_bus_message_close_container(m);
  sd_bus_message_close_container(m);
  sd_bus_error error{};
  const double beforeBig = daemonUniqueKiB();
  sd_bus_call(big.get(), m, 30'000'000, &error, nullptr);
  state.counters["oversize_refused"] = sd_bus_error_has_name(&error, "org.freedesktop.DBus.Error.InvalidArgs");
  state.counters["oversize_growth_KiB"] = daemonUniqueKiB() - beforeBig;
  sd_bus_error_free(&error);
}

BENCHMARK(BM_Idle)->Arg(1000)->UseRealTime()->Iterations(1);
BENCHMARK(BM_FloorDBusPing)->UseRealTime();
BENCHMARK_CAPTURE(BM_FloorHTTPS, metadata, Operation::metadata)->UseRealTime();
BENCHMARK_CAPTURE(BM_FloorHTTPS, activation, Operation::activation)->UseRealTime();
BENCHMARK_CAPTURE(BM_FloorHTTPS, confirmation, Operation::confirmation)->UseRealTime();
BENCHMARK_CAPTURE(BM_Operation, metadata, Operation::metadata)->UseRealTime();
BENCHMARK_CAPTURE(BM_Operation, activation, Operation::activation)->UseRealTime();
BENCHMARK_CAPTURE(BM_Operation, confirmation, Operation::confirmation)->UseRealTime();
BENCHMARK(BM_OperationBare)->UseRealTime();
BENCHMARK(BM_ThroughputFloor)->Arg(1)->Arg(8)->Arg(64)->Arg(256)->UseRealTime()->Iterations(1);
BENCHMARK(BM_Throughput)->Arg(1)->Arg(8)->Arg(64)->Arg(256)->UseRealTime()->Iterations(1);
BENCHMARK(BM_Idle)->Arg(6000)->UseRealTime()->Iterations(1);
BENCHMARK(BM_Resources)->UseRealTime()->Iterations(1);
BENCHMARK(BM_GreedyPeer)->Arg(5000)->UseRealTime()->Iterations(1);

}  // namespace

int main(int argc, char** argv) {
  // A thousand peers need a thousand descriptors here.
  rlimit files{};
  if (getrlimit(RLIMIT_NOFILE, &files) == 0) {
    files.rlim_cur = files.rlim_max;
    setrlimit(RLIMIT_NOFILE, &files);
  }
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}

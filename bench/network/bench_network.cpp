// End-to-end throughput and latency of the three operations against zlka-devserver on loopback,
// each beside its floor measured in the same run: the same signed HTTPS POSTs made directly with
// libcurl on one reused connection. Counters: p50/p90/p99 latency in microseconds and, for the
// service, each as a multiple of the floor's.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "bench_world.h"
#include "curl_device.h"
#include "network/zlka_network.h"
#include "platform/dispatch/semaphore.h"
#include "platform/listener/connection.h"
#include "platform/values/base64.h"

namespace netbench {
namespace {

using Clock = std::chrono::steady_clock;
using platform::Data;

enum class Operation { metadata, activation, confirmation };

BenchWorld* gWorld = nullptr;

struct Percentiles {
  double p50 = 0, p90 = 0, p99 = 0;
};
std::map<Operation, Percentiles> gFloor;

Percentiles percentiles(std::vector<double> samples) {
  Percentiles p;
  if (samples.empty()) return p;
  std::sort(samples.begin(), samples.end());
  auto at = [&](double q) {
    return samples[std::min(samples.size() - 1, static_cast<size_t>(q * static_cast<double>(samples.size())))];
  };
  p.p50 = at(0.50);
  p.p90 = at(0.90);
  p.p99 = at(0.99);
  return p;
}

void report(benchmark::State& state, const Percentiles& p) {
  state.SetItemsProcessed(state.iterations());
  state.counters["p50_us"] = p.p50;
  state.counters["p90_us"] = p.p90;
  state.counters["p99_us"] = p.p99;
}

Data token() {
  const std::string label = "bench-accessory-token";
  std::vector<uint8_t> bytes{0x30, static_cast<uint8_t>(label.size() + 2), 0x04, static_cast<uint8_t>(label.size())};
  bytes.insert(bytes.end(), label.begin(), label.end());
  return Data(std::move(bytes));
}

constexpr char kUUID[] = "3F2504E0-4F89-11D3-9A0C-0305E82C3301";

const char* endpointOf(Operation op) {
  switch (op) {
    case Operation::metadata:
      return "queryProductPlan";
    case Operation::activation:
      return "activateAccessory";
    case Operation::confirmation:
      return "ackAccessory";
  }
  return "";
}

// The body the service sends for the operation, byte for byte.
std::string bodyOf(Operation op) {
  nlohmann::json body{{"tokens", {platform::base64Encode(token().span())}}, {"uuid", kUUID}};
  if (op == Operation::metadata) body["locale"] = "en_US";
  return body.dump();
}

void BM_Floor(benchmark::State& state, Operation op) {
  CurlDevice device(gWorld->baseURL(), gWorld->caFile());
  device.associate();
  const std::string body = bodyOf(op);
  std::vector<double> samples;
  CurlAnswer answer;
  for (auto _ : state) {
    const auto start = Clock::now();
    const bool ok = device.post(endpointOf(op), body, answer);
    samples.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    if (!ok) {
      state.SkipWithError(("floor request failed with status " + std::to_string(answer.status)).c_str());
      break;
    }
  }
  const Percentiles p = percentiles(std::move(samples));
  gFloor[op] = p;
  report(state, p);
}

// One operation on the calling thread as a client's message, waited for.
bool runOnce(ZLKANetwork& network, Operation op) {
  auto done = std::make_shared<platform::Semaphore>();
  auto ok = std::make_shared<bool>(false);
  switch (op) {
    case Operation::metadata:
      network.requestMetadataForToken(token(), std::string(kUUID), platform::Locale("en_US"), std::nullopt,
                                      [done, ok](auto ppid, auto, auto, std::optional<platform::Error> error) {
                                        *ok = ppid && !error;
                                        done->signal();
                                      });
      break;
    case Operation::activation:
      network.requestActivationForToken(token(), std::string(kUUID),
                                        [done, ok](std::optional<Data> newToken, std::optional<platform::Error> error) {
                                          *ok = newToken && !error;
                                          done->signal();
                                        });
      break;
    case Operation::confirmation:
      network.confirmActivationForToken(token(), std::string(kUUID), [done, ok](std::optional<platform::Error> error) {
        *ok = !error;
        done->signal();
      });
      break;
  }
  return done->waitFor(std::chrono::seconds(60)) && *ok;
}

void BM_Service(benchmark::State& state, Operation op) {
  platform::Connection peer(":1.bench", [](std::string_view) -> std::optional<platform::Value> {
    return platform::Value(platform::Array{platform::Value("token-auth")});
  });
  platform::Connection::CurrentScope scope(&peer);
  auto network = ZLKANetwork::sharedInstance();
  if (!runOnce(*network, op)) {  // opens the session outside the measurement
    state.SkipWithError("the operation fails");
    return;
  }
  std::vector<double> samples;
  for (auto _ : state) {
    const auto start = Clock::now();
    const bool ok = runOnce(*network, op);
    samples.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    if (!ok) {
      state.SkipWithError("the operation failed");
      break;
    }
  }
  const Percentiles p = percentiles(std::move(samples));
  report(state, p);
  if (auto floor = gFloor.find(op); floor != gFloor.end() && floor->second.p50 > 0) {
    state.counters["p50_vs_floor"] = p.p50 / floor->second.p50;
    state.counters["p99_vs_floor"] = p.p99 / floor->second.p99;
  }
}

// Each floor runs just before its operation, so the ratio compares like with like.
BENCHMARK_CAPTURE(BM_Floor, metadata, Operation::metadata)->UseRealTime()->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_Service, metadata, Operation::metadata)->UseRealTime()->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_Floor, activation, Operation::activation)->UseRealTime()->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_Service, activation, Operation::activation)->UseRealTime()->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_Floor, confirmation, Operation::confirmation)->UseRealTime()->Unit(benchmark::kMicrosecond);
BENCHMARK_CAPTURE(BM_Service, confirmation, Operation::confirmation)->UseRealTime()->Unit(benchmark::kMicrosecond);

}  // namespace
}  // namespace netbench

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  try {
    netbench::BenchWorld world;
    netbench::gWorld = &world;
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    netbench::gWorld = nullptr;
  } catch (const std::exception& error) {
    std::fprintf(stderr, "bench_network: %s\n", error.what());
    return 1;
  }
  return 0;
}

// Signed round trips (device signs a request, server checks it and signs its answer, device
// verifies the answer) through TarvexSAPSession, next to the same round trip on the bare
// primitives. The session's overhead per round trip is the difference of the two times; the
// third case runs the session over no-op primitives, so that it measures the queues alone.
#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>

#include "platform/dispatch/semaphore.h"
#include "platform/log/log.h"
#include "sap/tarvex_sap_session.h"
#include "tarvexsap/tarvex_sap.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace {

constexpr std::chrono::seconds kGuard{10};
constexpr char kSessionId[] = "B3A1C0DE-0000-4000-8000-000000000001";

struct Fixture {
  TarvexSAPCredential root = *TarvexSAPMakeRoot("Bench SAP Root");
  TarvexSAPCredential setup = *TarvexSAPIssueSetupCertificate(root, "Bench Setup");
  std::vector<uint8_t> setupDER = *TarvexSAPCertToDER(setup.certificate.get());
  std::unique_ptr<TarvexSAPServer> server;

  Fixture() {
    const std::string pem = *TarvexSAPCertToPEM(root.certificate.get());
    const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(pem.data()), pem.size(), nullptr};
    if (TarvexSAPConfigure(&config) != kTarvexSAPOK) throw std::runtime_error("configure");
    server = *TarvexSAPServer::create(setupDER, setup.key.get());
  }
};

const platform::Data& requestBody() {
  static const platform::Data body = platform::Data(std::vector<uint8_t>(256, 'q'));
  return body;
}
const platform::Data& answerBody() {
  static const platform::Data body = platform::Data(std::vector<uint8_t>(512, 'a'));
  return body;
}

class ServerDelegate : public TarvexSAPSessionDelegate {
 public:
  explicit ServerDelegate(Fixture& f) : f_(f) {}
  void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession&, TarvexSAPDataCompletion completion) override {
    completion(platform::Data(f_.setupDER), std::nullopt);
  }
  void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session,
                                                          const std::optional<platform::Data>& request,
                                                          TarvexSAPDataCompletion completion) override {
    const auto answer = f_.server->handshake(session.UUID().UUIDString(), request->span(), std::chrono::hours(1));
    session.setTTL(3600);
    completion(platform::Data(answer.sessionInfo.data(), answer.sessionInfo.size()), std::nullopt);
  }

 private:
  Fixture& f_;
};

void openOrThrow(TarvexSAPSession& session) {
  platform::Semaphore done;
  bool ok = false;
  session.openWithCompletionHandler([&](std::optional<platform::Error> error) {
    ok = !error;
    done.signal();
  });
  if (!done.waitFor(kGuard) || !ok) throw std::runtime_error("open failed");
}

// One round trip through the session; the caller waits for each completion in turn.
bool sessionRoundTrip(TarvexSAPSession& session, TarvexSAPServer* server, const std::string& id) {
  platform::Semaphore done;
  std::optional<platform::Data> signature;
  session.signatureForData(requestBody(), [&](std::optional<platform::Data> s, std::optional<platform::Error>) {
    signature = std::move(s);
    done.signal();
  });
  if (!done.waitFor(kGuard) || !signature) return false;
  platform::Data responseSignature;
  if (server) {
    const auto accepted = server->verifyRequest(id, signature->span(), requestBody().span());
    const auto answer = server->signResponse(id, accepted.seq, answerBody().span());
    if (accepted.status != TarvexSAPServerStatus::ok || answer.status != TarvexSAPServerStatus::ok) return false;
    responseSignature = platform::Data(answer.signature.data(), answer.signature.size());
  } else {
    responseSignature = *signature;
  }
  bool valid = false;
  session.verifySignature(responseSignature, answerBody(), [&](bool v, std::optional<platform::Error>) {
    valid = v;
    done.signal();
  });
  return done.waitFor(kGuard) && valid;
}

using Clock = std::chrono::steady_clock;

// Round trips per second, and wall-clock microseconds per round trip (the figure to subtract).
void reportRoundTrips(benchmark::State& state, Clock::time_point started) {
  const double micros = std::chrono::duration<double, std::micro>(Clock::now() - started).count();
  state.SetItemsProcessed(state.iterations());
  state.counters["us_per_round_trip"] = benchmark::Counter(micros, benchmark::Counter::kAvgIterations);
}

void BM_RoundTripBarePrimitives(benchmark::State& state) {
  Fixture f;
  TarvexHWInfo_ hw{};
  QVSAPContextOpaque_* context = nullptr;
  uint8_t* out = nullptr;
  uint32_t outLength = 0;
  uint8_t rc = 255;
  if (TarvexSAPInit(&context, &hw) != 0 ||
      TarvexSAPExchange(200, &hw, context, f.setupDER.data(), f.setupDER.size(), &out, &outLength, &rc) != 0)
    throw std::runtime_error("handshake request");
  auto info = f.server->handshake(kSessionId, {out, outLength}, std::chrono::hours(1));
  std::free(out);
  out = nullptr;
  if (TarvexSAPExchange(200, &hw, context, info.sessionInfo.data(), info.sessionInfo.size(), &out, &outLength, &rc) !=
      0)
    throw std::runtime_error("session info");
  std::free(out);

  const auto started = Clock::now();
  for (auto _ : state) {
    uint8_t* signature = nullptr;
    uint32_t signatureLength = 0;
    if (TarvexSAPSign(context, requestBody().bytes(), requestBody().length(), &signature, &signatureLength) != 0)
      throw std::runtime_error("sign");
    const auto accepted = f.server->verifyRequest(kSessionId, {signature, signatureLength}, requestBody().span());
    std::free(signature);
    const auto answer = f.server->signResponse(kSessionId, accepted.seq, answerBody().span());
    std::vector<uint8_t> copy = answerBody().toVector();  // the session verifies a private copy too
    if (TarvexSAPVerify(context, answer.signature.data(), answer.signature.size(), copy.data(), copy.size()) != 0)
      throw std::runtime_error("verify");
  }
  TarvexSAPTeardown(context);
  reportRoundTrips(state, started);
}
BENCHMARK(BM_RoundTripBarePrimitives)->UseRealTime();

void BM_RoundTripThroughSession(benchmark::State& state) {
  Fixture f;
  auto delegate = std::make_shared<ServerDelegate>(f);
  auto session = TarvexSAPSession::sessionWithDelegate(delegate);
  openOrThrow(*session);
  const std::string id = session->UUID().UUIDString();
  const auto started = Clock::now();
  for (auto _ : state)
    if (!sessionRoundTrip(*session, f.server.get(), id)) throw std::runtime_error("round trip");
  reportRoundTrips(state, started);
}
BENCHMARK(BM_RoundTripThroughSession)->UseRealTime();

// The session's own cost: queues, hops and copies around primitives that do nothing.
void BM_SessionOverNoOpPrimitives(benchmark::State& state) {
  TarvexSAPPrimitives noop;
  noop.init = [](QVSAPContextOpaque_** c, TarvexHWInfo_*) {
    *c = reinterpret_cast<QVSAPContextOpaque_*>(uintptr_t{1});
    return 0;
  };
  noop.exchange = [](int32_t, TarvexHWInfo_*, QVSAPContextOpaque_*, const uint8_t*, size_t, uint8_t** out,
                     uint32_t* outLength, uint8_t* rc) {
    static thread_local int step = 0;
    if (step++ % 2 == 0) {
      *out = static_cast<uint8_t*>(std::malloc(90));
      std::memset(*out, 0, 90);
      *outLength = 90;
      *rc = 1;
    } else {
      *rc = 0;
    }
    return 0;
  };
  noop.sign = [](QVSAPContextOpaque_*, const uint8_t*, size_t, uint8_t** s, uint32_t* n) {
    *s = static_cast<uint8_t*>(std::malloc(40));
    std::memset(*s, 0, 40);
    *n = 40;
    return 0;
  };
  noop.verify = [](QVSAPContextOpaque_*, const uint8_t*, size_t, uint8_t*, size_t) { return 0; };
  noop.teardown = [](QVSAPContextOpaque_*) { return 0; };
  struct Delegate : TarvexSAPSessionDelegate {
    void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession&, TarvexSAPDataCompletion c) override {
      c(platform::Data::fromString("cert"), std::nullopt);
    }
    void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& s, const std::optional<platform::Data>&,
                                                            TarvexSAPDataCompletion c) override {
      s.setTTL(3600);
      c(platform::Data::fromString("info"), std::nullopt);
    }
  };
  auto delegate = std::make_shared<Delegate>();
  auto session = TarvexSAPSession::sessionWithDelegate(delegate, noop);
  openOrThrow(*session);
  const auto started = Clock::now();
  for (auto _ : state)
    if (!sessionRoundTrip(*session, nullptr, "")) throw std::runtime_error("round trip");
  reportRoundTrips(state, started);
}
BENCHMARK(BM_SessionOverNoOpPrimitives)->UseRealTime();

}  // namespace

// The session logs each close at the default level; keep that out of the figures' output.
int main(int argc, char** argv) {
  platform::LogSettings quiet = platform::currentLogSettings();
  quiet.minimum = platform::LogLevel::Error;
  platform::configureLog(quiet);
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}

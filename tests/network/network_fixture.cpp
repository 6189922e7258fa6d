#include "network_fixture.h"

#include <mutex>

#include "network/zlka_network_constants.h"
#include "platform/semaphore.h"

namespace nettest {

zlkatest::LogCapture& log() {
  // Never destroyed: the network's threads may still log while the process exits.
  static auto* capture = new zlkatest::LogCapture;
  return *capture;
}

// Installed before anything logs, so that the log's own state outlives the shared instance,
// whose destructor logs at exit.
namespace {
[[maybe_unused]] const zlkatest::LogCapture& kInstalled = log();
}  // namespace

std::unique_ptr<platform::Connection> peer(std::optional<Value> entitlement) {
  return std::make_unique<platform::Connection>(":1.test", [entitlement](std::string_view name) -> std::optional<Value> {
    return name == ZLKAEntitlement ? entitlement : std::nullopt;
  });
}

Data derItem(uint8_t tag, std::string_view content) {
  std::vector<uint8_t> out{tag};
  if (content.size() >= 0x100)
    out.insert(out.end(), {0x82, static_cast<uint8_t>(content.size() >> 8)});
  else if (content.size() >= 0x80)
    out.push_back(0x81);
  out.push_back(static_cast<uint8_t>(content.size()));
  out.insert(out.end(), content.begin(), content.end());
  return Data(std::move(out));
}

Data sampleToken(std::string_view label) { return derItem(0x30, derItem(0x04, label).view()); }

void start(const Call& call, std::function<void(Outcome)> reply) {
  auto network = ZLKANetwork::sharedInstance();
  switch (call.op) {
    case Op::metadata: {
      std::optional<platform::Locale> locale;
      if (call.locale) locale.emplace(*call.locale);
      return network->requestMetadataForToken(
          call.token, call.uuid, locale, call.requestInfo, [reply](auto ppid, auto locale, auto metadata, auto error) {
            const bool values = ppid || locale || metadata;
            reply({.ppid = ppid, .locale = locale, .metadata = metadata, .error = error, .hasValues = values});
          });
    }
    case Op::activation:
      return network->requestActivationForToken(call.token, call.uuid, [reply](auto newToken, auto error) {
        reply({.newToken = newToken, .error = error, .hasValues = newToken.has_value()});
      });
    case Op::confirmation:
      return network->confirmActivationForToken(call.token, call.uuid, [reply](auto error) { reply({.error = error}); });
  }
}

Outcome run(const Call& call, platform::Connection* caller) {
  struct Box {
    std::mutex mutex;
    Outcome outcome;
    platform::Semaphore first;
  };
  auto box = std::make_shared<Box>();
  box->outcome.logStart = log().size();
  {
    std::unique_ptr<platform::Connection> entitled = caller ? nullptr : peer();
    platform::Connection::CurrentScope scope(caller ? caller : entitled.get());
    start(call, [box](Outcome got) {
      std::lock_guard lock(box->mutex);
      if (box->outcome.replies++ > 0) return;
      got.replies = 1;
      got.logStart = box->outcome.logStart;
      got.logMark = log().size();
      box->outcome = std::move(got);
      box->first.signal();
    });
  }
  if (!box->first.waitFor(kReplyGuard)) ADD_FAILURE() << "no reply";
  ZLKANetwork::sharedInstance()->urlSession()->callbackQueue()->sync([] {});  // where a second reply would come from
  std::lock_guard lock(box->mutex);
  return box->outcome;
}

void expectFailure(const Outcome& outcome, int64_t code) {
  EXPECT_EQ(outcome.replies, 1);
  EXPECT_FALSE(outcome.hasValues);
  ASSERT_TRUE(outcome.error) << "expected error " << code << "\n" << log().dump();
  EXPECT_EQ(*outcome.error, ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, code)) << outcome.error->description();
  const std::string line = "[#TokenAuth] error: " + outcome.error->description();
  EXPECT_TRUE(log().find(LogLevel::Fault, line, outcome.logStart, outcome.logMark)) << "not logged before the reply: " << line;
}

void expectLine(LogLevel level, const std::string& prefix, size_t from) {
  for (const auto& e : log().entries(from))
    if (e.level == level && e.message.starts_with(prefix)) return;
  ADD_FAILURE() << "no " << platform::logLevelName(level) << " line starting with: " << prefix << "\n" << log().dump();
}

std::optional<json> uploadedBody(size_t from) {
  const std::string prefix = "[#TokenAuth] requestData (string): ";
  for (const auto& e : log().entries(from)) {
    if (!e.message.starts_with(prefix)) continue;
    json body = json::parse(e.message.substr(prefix.size()), nullptr, false);
    if (body.is_object() && !body.contains("session-request")) return body;  // not the handshake's
  }
  return std::nullopt;
}

void NetworkTest::SetUp() {
  ASSERT_NO_FATAL_FAILURE(admin().reset());
  suite().clear();
  installSession();
  log().clear();
}

void NetworkTest::TearDown() {
  admin().clearFaults();
  suite().clear();
}

std::shared_ptr<TarvexSAPSession> NetworkTest::installSession(TarvexSAPPrimitives primitives) {
  auto session = TarvexSAPSession::sessionWithDelegate(network(), std::move(primitives));
  network()->setTarvexSAPSession(session);
  return session;
}

}  // namespace nettest

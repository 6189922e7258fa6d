// The listener in-process on a private bus: working out who a peer is must never hold up anyone else.
#include "platform/listener.h"

#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <future>
#include <thread>

#include "common/private_bus.h"
#include "platform/handles.h"

namespace {

constexpr char kName[] = "com.example.ListenerTest";
constexpr char kPath[] = "/com/example/ListenerTest";
constexpr char kInterface[] = "com.example.ListenerTest";

class Accepting : public platform::ListenerDelegate {
 public:
  explicit Accepting(std::shared_ptr<const platform::Interface> interface) : interface_(std::move(interface)) {}
  bool listenerShouldAcceptNewConnection(platform::Listener&, platform::Connection& connection) override {
    connection.setExportedInterface(interface_);
    connection.resume();
    return true;
  }

 private:
  std::shared_ptr<const platform::Interface> interface_;
};

// Echo(s) -> s answers its argument.
std::shared_ptr<const platform::Interface> echoInterface() {
  platform::InterfaceMethod echo{"Echo", "s", "s", {"text"}, {"text"}, nullptr};
  echo.decode = [](sd_bus_message* m, const std::shared_ptr<void>&) {
    const char* text = nullptr;
    if (sd_bus_message_read(m, "s", &text) < 0) return platform::DecodedCall{nullptr, platform::BusError{platform::kBusErrorInvalidArgs, "text"}};
    return platform::DecodedCall{[echoed = std::string(text)](platform::Reply reply) {
                                   reply.send([echoed](sd_bus_message* r) { return sd_bus_message_append(r, "s", echoed.c_str()); });
                                 },
                                 std::nullopt};
  };
  return std::make_shared<platform::Interface>(platform::Interface{kInterface, {echo}});
}

platform::BusPtr connect(const std::string& address) {
  sd_bus* bus = nullptr;
  sd_bus_new(&bus);
  platform::BusPtr owned(bus);
  sd_bus_set_address(bus, address.c_str());
  sd_bus_set_bus_client(bus, 1);
  return sd_bus_start(bus) >= 0 ? std::move(owned) : nullptr;
}

// Calls Echo and waits at most `timeout` for the answer; nullopt when none came.
std::optional<std::string> echo(sd_bus* bus, const char* text, uint64_t timeoutUsec) {
  sd_bus_message* made = nullptr;
  sd_bus_message_new_method_call(bus, &made, kName, kPath, kInterface, "Echo");
  platform::BusMessagePtr call(made);
  sd_bus_message_append(call.get(), "s", text);
  platform::BusErrorGuard error;
  sd_bus_message* answer = nullptr;
  if (sd_bus_call(bus, call.get(), timeoutUsec, &error.error, &answer) < 0) return std::nullopt;
  platform::BusMessagePtr reply(answer);
  const char* echoed = nullptr;
  if (sd_bus_message_read(reply.get(), "s", &echoed) < 0) return std::nullopt;
  return echoed;
}

bool nameHasOwner(sd_bus* bus) {
  sd_bus_message* answer = nullptr;
  if (sd_bus_call_method(bus, "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus", "NameHasOwner",
                         nullptr, &answer, "s", kName) < 0)
    return false;
  platform::BusMessagePtr reply(answer);
  int owned = 0;
  return sd_bus_message_read(reply.get(), "b", &owned) >= 0 && owned;
}

// The service listener running on a thread of its own until the scope ends.
class RunningListener {
 public:
  explicit RunningListener(std::shared_ptr<const platform::Interface> interface)
      : listener_(platform::Listener::serviceListener()) {
    listener_.setDelegate(std::make_shared<Accepting>(std::move(interface)));
    loop_ = std::thread([this] {
      platform::Listener::blockSignals();
      listener_.resume();
      ended_ = true;
    });
  }
  ~RunningListener() {
    // stop() only reaches a listener that has started; repeat it until the loop has ended.
    for (int i = 0; i < 3000 && !ended_; ++i) {
      listener_.stop();
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    loop_.join();
    listener_.setDelegate(nullptr);
  }

 private:
  platform::Listener& listener_;
  std::atomic<bool> ended_{false};
  std::thread loop_;
};

struct OnExit {
  std::function<void()> run;
  ~OnExit() { run(); }
};

}  // namespace

TEST(Listener, APeerWhoseIdentityIsSlowHoldsUpNoOtherPeer) {
  client_test::PrivateBus bus;
  ASSERT_TRUE(bus.running());
  std::promise<void> release;
  std::shared_future<void> lookupMayEnd = release.get_future().share();
  std::atomic<int> lookups{0};
  std::atomic<pid_t> firstPid{0};

  platform::ListenerOptions options;
  options.bus = bus.address();
  options.serviceName = kName;
  options.objectPath = kPath;
  options.interface = echoInterface();
  options.notifyReady = false;
  options.entitlementsForPeer = [&](const platform::PeerCredentials& credentials) -> platform::EntitlementLookup {
    // The first peer's lookup is held back until the test lets it go.
    if (lookups.fetch_add(1) == 0) {
      firstPid = credentials.pid;
      lookupMayEnd.wait();
    }
    return nullptr;
  };
  platform::Listener::configure(options);
  std::optional<RunningListener> running(std::in_place, options.interface);
  platform::BusPtr slow = connect(bus.address()), quick = connect(bus.address());
  ASSERT_TRUE(slow && quick);
  for (int i = 0; i < 500 && !nameHasOwner(quick.get()); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  std::optional<std::string> slowAnswer;
  std::atomic<bool> slowAnswered{false};
  std::jthread slowCaller([&] {
    slowAnswer = echo(slow.get(), "slow", 30'000'000);
    slowAnswered = true;
  });
  bool released = false;
  OnExit releaseOnFailure{[&] {
    if (!released) release.set_value();
  }};
  for (int i = 0; i < 500 && lookups.load() == 0; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  EXPECT_EQ(lookups.load(), 1) << "the first peer's call never reached the listener";
  EXPECT_EQ(firstPid.load(), getpid());

  // The other peer is served while the first one's identity is still being worked out.
  EXPECT_EQ(echo(quick.get(), "quick", 5'000'000), "quick");
  EXPECT_FALSE(slowAnswered.load());

  release.set_value();
  released = true;
  slowCaller.join();
  EXPECT_EQ(slowAnswer, "slow");
}

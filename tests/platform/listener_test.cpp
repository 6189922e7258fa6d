// The listener in-process on a private bus: working out who a peer is must never hold up anyone else.
#include "platform/listener.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "common/log_capture.h"
#include "common/private_bus.h"
#include "platform/handles.h"
#include "platform/semaphore.h"

namespace {

using namespace std::chrono_literals;
constexpr char kName[] = "com.example.ListenerTest";
constexpr char kPath[] = "/com/example/ListenerTest";

// Ping() answers at once; who asked and when is all these tests look at.
std::shared_ptr<const platform::Interface> pingInterface() {
  platform::InterfaceMethod ping{
      "Ping", "", "", {}, {}, [](sd_bus_message*, const std::shared_ptr<void>&) {
        return platform::DecodedCall{[](platform::Reply reply) { reply.send(nullptr); }, std::nullopt};
      }};
  return std::make_shared<platform::Interface>(platform::Interface{kName, {ping}});
}

struct Accepting : platform::ListenerDelegate {
  bool listenerShouldAcceptNewConnection(platform::Listener&, platform::Connection& connection) override {
    connection.setExportedInterface(pingInterface());
    connection.resume();
    return true;
  }
};

platform::BusPtr connect(const std::string& address) {
  sd_bus* bus = nullptr;
  sd_bus_new(&bus);
  platform::BusPtr owned(bus);
  sd_bus_set_address(bus, address.c_str());
  sd_bus_set_bus_client(bus, 1);
  sd_bus_set_method_call_timeout(bus, 30'000'000);
  return sd_bus_start(bus) >= 0 ? std::move(owned) : nullptr;
}

bool ping(const platform::BusPtr& bus) {
  return sd_bus_call_method(bus.get(), kName, kPath, kName, "Ping", nullptr, nullptr, "") >= 0;
}

// The service listener running on a thread of its own until the scope ends.
struct RunningListener {
  platform::Listener& listener = platform::Listener::serviceListener();
  std::atomic<bool> ended{false};
  std::jthread loop{[this] {
    platform::Listener::blockSignals();
    listener.resume();
    ended = true;
  }};
  ~RunningListener() {
    for (int i = 0; i < 3000 && !ended; ++i, std::this_thread::sleep_for(10ms))
      listener.stop();  // reaches it once started
  }
};

}  // namespace

TEST(Listener, APeerWhoseIdentityIsSlowHoldsUpNoOtherPeerAndEachPeerIsIdentifiedOnce) {
  client_test::PrivateBus bus;
  ASSERT_TRUE(bus.running());
  zlkatest::LogCapture log;
  platform::Semaphore release;  // bounded, so that a failing test still ends
  std::atomic<int> lookups{0};
  std::atomic<pid_t> firstPid{0};
  platform::Listener::configure(
      {.bus = bus.address(),
       .serviceName = kName,
       .objectPath = kPath,
       .interface = pingInterface(),
       .entitlementsForPeer = [&](const platform::PeerCredentials& credentials) -> platform::EntitlementLookup {
         if (lookups.fetch_add(1) == 0) {  // the first peer's lookup is held back until the test lets it go
           firstPid = credentials.pid;
           release.waitFor(30s);
         }
         return nullptr;
       },
       .onReload = {},
       .exitOnIdle = {},
       .notifyReady = false});
  platform::Listener::serviceListener().setDelegate(std::make_shared<Accepting>());
  std::optional<RunningListener> running(std::in_place);
  platform::BusPtr slow = connect(bus.address()), quick = connect(bus.address());
  ASSERT_TRUE(slow && quick);
  for (int i = 0;
       i < 500 && sd_bus_call_method(quick.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus",
                                     "org.freedesktop.DBus", "GetNameOwner", nullptr, nullptr, "s", kName) < 0;
       ++i)
    std::this_thread::sleep_for(10ms);
  std::atomic<bool> slowAnswered{false}, slowOk{false};
  std::jthread slowCaller([&] { slowOk = ping(slow), slowAnswered = true; });
  for (int i = 0; i < 500 && lookups.load() == 0; ++i) std::this_thread::sleep_for(10ms);
  EXPECT_EQ(lookups.load(), 1) << "the first peer's call never reached the listener";
  EXPECT_EQ(firstPid.load(), getpid());
  EXPECT_EQ(log.countStartingWith("Listening as com.example.ListenerTest on unix:"), 1) << log.dump();
  // The other peer is served while the first one's identity is still being worked out.
  EXPECT_TRUE(ping(quick) && ping(quick));
  EXPECT_FALSE(slowAnswered.load());
  release.signal();
  slowCaller.join();
  EXPECT_TRUE(slowOk.load());  // the backlog waited for the identity
  EXPECT_EQ(lookups.load(), 2);
  quick.reset();  // a peer that leaves the bus is forgotten
  for (int i = 0; i < 500 && platform::Listener::serviceListener().connectionCount() != 1; ++i)
    std::this_thread::sleep_for(10ms);
  EXPECT_EQ(platform::Listener::serviceListener().connectionCount(), 1u);
  running.reset();
  platform::Listener::serviceListener().setDelegate(nullptr);
}

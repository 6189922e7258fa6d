// The listener in-process on a private bus: working out who a peer is must never hold up anyone else.
#include "platform/listener/listener.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "common/child_process.h"
#include "common/log_capture.h"
#include "platform/bus/handles.h"
#include "platform/dispatch/semaphore.h"

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
  std::shared_ptr<const platform::Interface> interface;
  explicit Accepting(std::shared_ptr<const platform::Interface> exported) : interface(std::move(exported)) {}
  bool listenerShouldAcceptNewConnection(platform::Listener&, platform::Connection& connection) override {
    connection.setExportedInterface(interface);
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

// The service listener on a private bus, exporting `interface` to every peer, running on a thread
// of its own until the scope ends.
struct RunningListener {
  zlkatest::PrivateBus bus;
  platform::Listener& listener = platform::Listener::serviceListener();
  std::atomic<bool> ended{false};
  std::jthread loop;
  RunningListener(
      std::shared_ptr<const platform::Interface> interface, size_t maxCallsPerPeer,
      std::function<platform::EntitlementLookup(const platform::PeerCredentials&)> entitlementsForPeer = {}) {
    platform::ListenerOptions options;
    options.bus = bus.address(), options.serviceName = kName, options.objectPath = kPath, options.notifyReady = false;
    options.interface = interface, options.maxCallsPerPeer = maxCallsPerPeer,
    options.entitlementsForPeer = entitlementsForPeer;
    platform::Listener::configure(options);
    listener.setDelegate(std::make_shared<Accepting>(interface));
    loop = std::jthread([this] {
      platform::Listener::blockSignals();
      listener.resume();
      ended = true;
    });
  }
  ~RunningListener() {
    for (int i = 0; i < 3000 && !ended; ++i, std::this_thread::sleep_for(10ms))
      listener.stop();  // reaches it once started
    loop.join();
    listener.setDelegate(nullptr);
  }
};

}  // namespace

TEST(Listener, APeerWhoseIdentityIsSlowHoldsUpNoOtherPeerAndEachPeerIsIdentifiedOnce) {
  zlkatest::LogCapture log;
  platform::Semaphore release;  // bounded, so that a failing test still ends
  std::atomic<int> lookups{0};
  std::atomic<pid_t> firstPid{0};
  RunningListener running(
      pingInterface(), 8, [&](const platform::PeerCredentials& credentials) -> platform::EntitlementLookup {
        if (lookups.fetch_add(1) == 0) {  // the first peer's lookup is held back until the test lets it go
          firstPid = credentials.pid;
          release.waitFor(30s);
        }
        return nullptr;
      });
  platform::BusPtr slow = connect(running.bus.address()), quick = connect(running.bus.address());
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
}

// A greedy peer's calls beyond the per-peer bound wait, in order, until earlier ones are answered;
// another peer is served meanwhile, and every call is answered once.
TEST(Listener, APeerHasAtMostItsBoundOfCallsWorkedOnAndTheRestWaitInOrder) {
  std::mutex mutex;
  std::vector<platform::Reply> held;  // the calls being worked on, answered when the test says
  std::vector<int> order;
  platform::InterfaceMethod hold{"Hold", "i", "", {"n"}, {}, [&](sd_bus_message* m, const std::shared_ptr<void>&) {
                                   int n = -1;
                                   sd_bus_message_read(m, "i", &n);
                                   return platform::DecodedCall{[&, n](platform::Reply reply) {
                                                                  std::lock_guard lock(mutex);
                                                                  held.push_back(reply), order.push_back(n);
                                                                },
                                                                std::nullopt};
                                 }};
  auto interface = std::make_shared<platform::Interface>(*pingInterface());
  interface->methods.push_back(hold);
  RunningListener running(interface, 3);
  platform::BusPtr greedy = connect(running.bus.address()), other = connect(running.bus.address());
  ASSERT_TRUE(greedy && other);
  for (int i = 0; i < 500 && !ping(other); ++i) std::this_thread::sleep_for(10ms);
  constexpr int kCalls = 10;
  std::atomic<int> answered{0};
  auto onAnswer = [](sd_bus_message* m, void* count, sd_bus_error*) {
    if (!sd_bus_message_is_method_error(m, nullptr)) ++*static_cast<std::atomic<int>*>(count);
    return 0;
  };
  for (int n = 0; n < kCalls; ++n)
    ASSERT_GE(sd_bus_call_method_async(greedy.get(), nullptr, kName, kPath, kName, "Hold", onAnswer, &answered, "i", n),
              0);
  sd_bus_flush(greedy.get());
  auto heldCount = [&] {
    std::lock_guard lock(mutex);
    return held.size();
  };
  for (int i = 0; i < 500 && heldCount() < 3; ++i) std::this_thread::sleep_for(10ms);
  EXPECT_TRUE(ping(other));  // served while the greedy peer is at its bound
  std::this_thread::sleep_for(100ms);
  EXPECT_EQ(heldCount(), 3u);
  for (int i = 0; i < 3000 && answered < kCalls; ++i) {
    std::vector<platform::Reply> answering;
    {
      std::lock_guard lock(mutex);
      answering.swap(held);
    }
    for (auto& reply : answering) reply.send(nullptr);
    while (sd_bus_process(greedy.get(), nullptr) > 0) {
    }
    sd_bus_wait(greedy.get(), 10'000);
  }
  EXPECT_EQ(answered.load(), kCalls);
  EXPECT_EQ(order, (std::vector<int>{0, 1, 2, 3, 4, 5, 6, 7, 8, 9}));
}

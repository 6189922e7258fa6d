// The stand-in for the daemon that the client tests call: on a private bus it owns the daemon's
// name, records every call to the daemon's object as wire text and answers as the test says.
#pragma once

#include <gtest/gtest.h>
#include <systemd/sd-bus.h>

#include <atomic>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "client/zlka_client.h"
#include "common/private_bus.h"

namespace client_test {

// A call as "Member arguments" with every wire type shown, so that a test sees exactly what was
// sent: RequestActivationForToken a{sv}[s:"token"=<ay:0a0b>,s:"uuid"=<s:"U">]. Basic values are
// type:value (b, u, x, t, d, s), byte arrays ay:hex, arrays a<contents>[...], dictionary entries
// key=value, variants <...>; arguments are separated by a space.
std::string wireText(sd_bus_message* call);

class EchoService {
 public:
  // Replies to one call; false leaves it unanswered for as long as the service lives.
  using Answer = std::function<bool(sd_bus_message* call)>;
  // Metadata ("ppid-1", "en_US", {"plan":"basic","seats":2}), activation de ad be ef, confirmation nothing.
  static bool canned(sd_bus_message* call);
  static bool hold(sd_bus_message*) { return false; }
  static Answer error(std::string name, std::string message) {
    return [=](sd_bus_message* m) { return sd_bus_reply_method_errorf(m, name.c_str(), "%s", message.c_str()) >= 0; };
  }

  explicit EchoService(const std::string& address);  // the name is owned once this returns
  ~EchoService();
  bool ready() const { return thread_.joinable(); }
  void answerWith(Answer answer);
  std::vector<std::string> calls() const;  // wireText of each, oldest first
  bool waitForCalls(size_t count) const;   // false when they have not all come within a minute

 private:
  static int onMessage(sd_bus_message* m, void* self, sd_bus_error*) noexcept;
  sd_bus* bus_ = nullptr;
  std::atomic<bool> stop_{false};
  std::thread thread_;
  mutable std::mutex mutex_;
  mutable std::condition_variable arrived_;
  Answer answer_ = canned;
  std::vector<std::string> calls_;
  std::vector<sd_bus_message*> held_;  // service thread only
};

// A result as text: the answer, or "domain code: description".
std::string shown(const platform::Error& error);
std::string shown(const zlka_client::MetadataReply& reply);
std::string shown(const platform::Data& data);
std::string shown(const zlka_client::Confirmation&);
std::string shown(const platform::Array& values);
template <class T>
std::string shown(const zlka_client::Result<T>& result) {
  return result.ok() ? shown(result.value()) : shown(result.error());
}

// The results of asynchronous calls, shown, and the threads their callbacks ran on.
class Inbox {
 public:
  template <class T>
  std::function<void(zlka_client::Result<T>)> callback() {
    return [this](zlka_client::Result<T> result) { add(shown(result)); };
  }
  std::vector<std::string> wait(size_t count);  // once `count` have come, or after a minute
  std::set<std::thread::id> threads();

 private:
  void add(std::string result);
  std::mutex mutex_;
  std::condition_variable arrived_;
  std::vector<std::string> results_;
  std::set<std::thread::id> threads_;
};

// A private bus with the echo service and a client connected to it.
class ClientTest : public testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(service->ready() && (client = connect())); }
  std::unique_ptr<zlka_client::ZLKAClient> connect(std::chrono::microseconds timeout = std::chrono::minutes(5)) {
    auto made = zlka_client::ZLKAClient::connect({.bus = bus->address(), .callTimeout = timeout});
    return made.ok() ? std::move(made).value() : nullptr;
  }
  std::string lastCall() const { return service->calls().empty() ? "" : service->calls().back(); }

  std::unique_ptr<PrivateBus> bus = std::make_unique<PrivateBus>();
  std::unique_ptr<EchoService> service = std::make_unique<EchoService>(bus->address());
  std::unique_ptr<zlka_client::ZLKAClient> client;
};

}  // namespace client_test

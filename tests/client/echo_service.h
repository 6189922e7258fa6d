// A stand-in for the daemon on a private bus: it owns the daemon's bus name, receives every call
// to the daemon's object, keeps what it received (as wire text, see wire_text.h) and answers as
// the test tells it. It runs its own connection and event loop on a thread of its own.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <condition_variable>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace client_test {

struct ReceivedCall {
  std::string interface;
  std::string member;
  std::string arguments;  // wireText of the call
};

class EchoService {
 public:
  // Appends the out arguments of a successful answer.
  using ReplyWriter = std::function<int(sd_bus_message* reply)>;
  struct Answer {
    enum class Kind { Canned, Error, Custom, Hold } kind = Kind::Canned;
    std::string errorName, errorMessage;  // Error
    ReplyWriter write;                    // Custom
  };
  // The canned answers: metadata ("ppid-1", "en_US", {"plan":"basic","seats":2}), activation
  // bytes 0xde 0xad 0xbe 0xef, confirmation nothing.
  static Answer canned() { return {}; }
  static Answer error(std::string name, std::string message) { return {Answer::Kind::Error, std::move(name), std::move(message), nullptr}; }
  static Answer custom(ReplyWriter write) { return {Answer::Kind::Custom, "", "", std::move(write)}; }
  // No answer at all (until the service goes away).
  static Answer hold() { return {Answer::Kind::Hold, "", "", nullptr}; }

  explicit EchoService(const std::string& address);  // the name is owned when this returns
  ~EchoService();
  EchoService(const EchoService&) = delete;
  EchoService& operator=(const EchoService&) = delete;

  bool ready() const { return ready_; }
  void answerWith(Answer answer);  // for every later call
  std::vector<ReceivedCall> calls() const;
  // Blocks until at least `count` calls have arrived.
  void waitForCalls(size_t count) const;
  std::optional<ReceivedCall> lastCall() const;

 private:
  static int onMessage(sd_bus_message* m, void* userdata, sd_bus_error* error) noexcept;
  static int onStop(sd_event_source* source, int fd, uint32_t events, void* userdata) noexcept;

  sd_bus* bus_ = nullptr;
  sd_event* event_ = nullptr;
  sd_bus_slot* object_ = nullptr;
  sd_event_source* stopSource_ = nullptr;
  int stopFd_ = -1;
  bool ready_ = false;
  std::thread thread_;

  mutable std::mutex mutex_;
  mutable std::condition_variable arrived_;
  Answer answer_;
  std::vector<ReceivedCall> calls_;
  std::vector<sd_bus_message*> held_;  // event thread only
};

}  // namespace client_test

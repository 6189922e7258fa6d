// BusCaller: one bus connection, served by an sd-event loop on a thread of its own, that sends
// method calls to the daemon's object and hands each answer to a handler on that thread.
//
// sd-bus objects are not thread-safe, so the connection is touched only on the event thread:
// calls from other threads are queued to it (through a platform::LoopMailbox). Every call's handler
// runs exactly once, on the event thread: with the reply, or with an error (a D-Bus error reply, a
// send failure, the timeout, or Cancelled when the caller is closed first). Only a call that cannot
// be queued for want of memory has its handler run at once on the calling thread, with that error.
// A blocking call made on the event thread itself (from a handler) is sent with sd_bus_call there,
// holding up other answers until it returns; from any other thread it waits for its handler to have
// run.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <unordered_map>

#include "client/result.h"
#include "platform/bus/handles.h"
#include "platform/bus/loop_mailbox.h"

namespace zlka_client {

class BusCaller : public std::enable_shared_from_this<BusCaller> {
 public:
  // Appends the call's arguments; a negative errno refuses the call.
  using ArgumentWriter = std::function<int(sd_bus_message* call)>;
  // Exactly one of reply and error is non-null.
  using ReplyHandler = std::function<void(sd_bus_message* reply, const platform::Error* error)>;

  // `bus`: "system", "session" or a D-Bus address ("unix:path=/run/x"). Waits until the bus has
  // accepted the connection, so that an unusable bus fails here (ConnectionFailed).
  static Result<std::shared_ptr<BusCaller>> open(const std::string& bus, std::chrono::microseconds callTimeout);
  ~BusCaller();
  BusCaller(const BusCaller&) = delete;
  BusCaller& operator=(const BusCaller&) = delete;

  // callAsync calls `method` of the service with what `write` appends and returns at once;
  // `handler` runs once, on the event thread, with the reply or with the error: the D-Bus error,
  // a failure to build or send the call, Cancelled when the caller closes first.
  void callAsync(std::string method, ArgumentWriter write, ReplyHandler handler);
  // callAndWait is callAsync that returns only after `handler` has run; it borrows its arguments
  // for that long. From the event thread itself it calls synchronously.
  void callAndWait(const std::string& method, const ArgumentWriter& write, const ReplyHandler& handler);
  // Hands `error` to `handler` on the event thread, for calls refused before they are sent.
  void failAsync(platform::Error error, ReplyHandler handler);

  // Stops the loop; calls not yet answered get Cancelled. Waits for the thread to end, unless
  // called on it (from a handler), in which case the thread ends once the handler returns.
  void close();
  // onEventThread is true when called from the thread that runs the handlers.
  bool onEventThread() const { return std::this_thread::get_id() == threadId_; }

 private:
  struct Pending {
    BusCaller* owner;
    uint64_t id;
    platform::BusSlotPtr slot;
    ReplyHandler handler;
  };

  BusCaller(platform::BusPtr bus, std::chrono::microseconds callTimeout);
  int start();
  // Queues `job` for the event thread, where it learns whether the caller is closing (and its call
  // is then cancelled). False when it cannot be queued; the job is then dropped unrun.
  bool post(std::function<void(bool closing)> job);
  platform::Error postFailure() const;
  void run();
  void finish();
  Result<platform::BusMessagePtr> newCall(const std::string& method, const ArgumentWriter& write);
  void send(const std::string& method, const ArgumentWriter& write, ReplyHandler handler);
  void sendAndWait(const std::string& method, const ArgumentWriter& write, const ReplyHandler& handler);
  static int onReply(sd_bus_message* reply, void* userdata, sd_bus_error* error) noexcept;

  // Declared in the order they depend on each other, so that they are released in reverse.
  platform::EventPtr event_;
  platform::BusPtr bus_;
  platform::LoopMailbox mailbox_;
  uint64_t timeoutUsec_;

  std::unordered_map<uint64_t, Pending> pending_;  // event thread only; nodes stay put for sd-bus
  uint64_t lastId_ = 0;
  std::thread thread_;
  std::thread::id threadId_;
};

}  // namespace zlka_client

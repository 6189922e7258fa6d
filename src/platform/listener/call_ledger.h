// CallLedger: the calls a listener has taken on and not yet answered, each with the message it
// answers and the peer it came from. It holds every such call until its one answer is sent, so a
// call is answered exactly once even when the work on it was lost (the drain answers what is
// left). Bus thread only, except open().
#pragma once

#include <systemd/sd-bus.h>

#include <atomic>
#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "platform/bus/handles.h"
#include "platform/bus/messaging.h"

namespace platform {

class CallLedger {
 public:
  // take records `call` (taking a reference) from the peer named `peer`, and returns the id that
  // answers it, never zero. It throws only for want of memory, and then records nothing.
  uint64_t take(sd_bus_message* call, const std::string& peer);

  // answer sends call `id` its return, with the out arguments written by `writer` (or an error when
  // they cannot be written), and forgets it. It returns the peer whose call it was, or nullopt when
  // `id` is not open (already answered).
  std::optional<std::string> answer(uint64_t id, const Reply::Writer& writer);

  // fail answers call `id` with `error` and forgets it; returns as answer() does.
  std::optional<std::string> fail(uint64_t id, const BusError& error);

  // failAll answers every open call with `error`, forgets them all, and returns how many there were.
  size_t failAll(const BusError& error);

  // open answers how many calls are taken and not yet answered; from any thread.
  size_t open() const { return open_.load(); }

  // sendError answers `call`, which the ledger does not hold, with `error`; a call refused before
  // it is taken on is answered this way.
  static void sendError(sd_bus_message* call, const BusError& error);

  // memberOf answers the method name of `m`, or "?".
  static std::string memberOf(sd_bus_message* m);

 private:
  struct Entry {
    BusMessagePtr call;
    std::string peer;  // unique bus name
  };
  std::optional<std::string> forget(std::map<uint64_t, Entry>::iterator entry);

  std::map<uint64_t, Entry> calls_;
  std::atomic<size_t> open_{0};
  uint64_t lastId_ = 0;
};

}  // namespace platform

// PeerTable: a listener's peers, by unique bus name. A peer's entry is made at its first message:
// its Connection, offered to the listener's delegate, and a request to the bus for who it is, sent
// without waiting. Its calls wait in order until that answer has come, then while it has its bound
// of calls worked on; each runs on the peer's queue with its connection current. The entry goes when
// the name leaves the bus. Bus thread only, except count().
#pragma once

#include <systemd/sd-bus.h>

#include <atomic>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "platform/bus/handles.h"
#include "platform/bus/messaging.h"
#include "platform/listener/connection.h"
#include "platform/listener/entitlement_manifests.h"

namespace platform {

class PeerTable {
 public:
  using EntitlementsForPeer = std::function<EntitlementLookup(const PeerCredentials&)>;

  // `owner` is asked, through its delegate, to accept each new peer; `entitlementsForPeer` (may be
  // null) runs once per identified peer on its queue; `maxCallsPerPeer` bounds its calls worked on.
  PeerTable(Listener& owner, EntitlementsForPeer entitlementsForPeer, size_t maxCallsPerPeer);
  PeerTable(const PeerTable&) = delete;
  PeerTable& operator=(const PeerTable&) = delete;

  // watch borrows `bus`, for the identity requests and to forget peers that leave it. It returns
  // zero, or a negative errno when leaving peers cannot be watched.
  int watch(sd_bus* bus);

  // connectionFor answers the connection of the peer named `sender`, making its entry at its first
  // message; null when the delegate refused the peer. It throws only when the entry cannot be made
  // (for want of memory or threads), and then records nothing, so the next message tries again.
  std::shared_ptr<Connection> connectionFor(const std::string& sender);

  // enqueue runs `invocation` on the queue of the peer named `sender` when its turn comes, keeping
  // it waiting until then; an unknown peer's call is dropped, and its reply answers for itself.
  void enqueue(const std::string& sender, MethodInvocation invocation, Reply reply);

  // finished notes that one call of the peer named `sender` was answered, letting its next one in.
  void finished(const std::string& sender);

  // count answers how many peers have an entry; from any thread.
  size_t count() const { return count_.load(); }

 private:
  struct CredentialsRequest {
    PeerTable* table;
    std::string peer;
  };
  struct Peer {
    std::shared_ptr<Connection> connection;  // null: refused by the delegate
    std::unique_ptr<CredentialsRequest> request;
    BusSlotPtr credentialsCall;  // declared after `request`, so released before it
    std::deque<std::pair<MethodInvocation, Reply>> backlog;
    size_t working = 0;
    bool identified = false;
  };

  static int onCredentials(sd_bus_message* reply, void* userdata, sd_bus_error*);
  void identify(Peer& peer, sd_bus_message* credentialsReply, const std::string& error);
  static std::optional<PeerCredentials> parseCredentials(sd_bus_message* reply);
  void pump(Peer& peer);
  static void schedule(const std::shared_ptr<Connection>& connection, MethodInvocation invocation, Reply reply);
  static int onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*);

  Listener& owner_;
  EntitlementsForPeer entitlementsForPeer_;
  size_t maxCallsPerPeer_;
  sd_bus* bus_ = nullptr;  // borrowed from the listener, which outlives the table
  std::map<std::string, Peer> peers_;
  std::atomic<size_t> count_{0};
  BusSlotPtr matchSlot_;  // declared last, so that no callback can find a half-gone table
};

}  // namespace platform

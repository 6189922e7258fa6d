// The listener's peer table: who each peer is, and its calls waiting their turn.
#include <fcntl.h>

#include <cstring>

#include "platform/listener_core.h"

namespace platform {

// The peer's entry, made at its first message. Nothing is recorded when making it fails (the
// delegate may run out of threads or memory), so that the peer's next message tries again.
Listener::Core::Peer& Listener::Core::peerFor(const std::string& sender) {
  auto it = peers_.find(sender);
  if (it != peers_.end()) return it->second;
  Peer made;
  auto connection = std::make_shared<Connection>(sender);
  std::shared_ptr<ListenerDelegate> delegate = owner_.delegate();
  if (delegate && delegate->listenerShouldAcceptNewConnection(owner_, *connection))
    made.connection = std::move(connection);
  if (made.connection) made.request = std::make_unique<CredentialsRequest>(CredentialsRequest{this, sender});
  Peer& peer = peers_.emplace(sender, std::move(made)).first->second;
  connectionCount_.store(peers_.size());
  if (!peer.connection) return peer;
  // Asked once, without waiting: the answer comes back to this thread like any other message.
  sd_bus_slot* slot = nullptr;
  int rc = sd_bus_call_method_async(bus_.get(), &slot, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                                    "org.freedesktop.DBus", "GetConnectionCredentials",
                                    &Guarded<&Core::onCredentials>::call, peer.request.get(), "s", sender.c_str());
  peer.credentialsCall.reset(slot);
  if (rc < 0) identify(peer, nullptr, std::string(strerror(-rc)));
  return peer;
}

int Listener::Core::onCredentials(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto* request = static_cast<CredentialsRequest*>(userdata);
  auto it = request->core->peers_.find(request->peer);
  if (it == request->core->peers_.end()) return 0;
  const sd_bus_error* error = sd_bus_message_get_error(reply);
  request->core->identify(it->second, error ? nullptr : reply, error && error->message ? error->message : "");
  return 0;
}

// Bus thread: the peer's identity is worked out first on its own queue (reading /proc may be
// slow), then its waiting calls follow in order. Without credentials it holds no entitlements.
void Listener::Core::identify(Peer& peer, sd_bus_message* credentialsReply, const std::string& error) {
  auto credentials = std::make_shared<std::optional<PeerCredentials>>();
  if (credentialsReply) *credentials = parseCredentials(credentialsReply);
  if (!*credentials)
    log(LogLevel::Error, "No credentials for peer %s%s%s: it holds no entitlements", peer.connection->peerName(),
        error.empty() ? "" : ": ", error);
  else if (options_.entitlementsForPeer)
    peer.connection->queue()->async(
        [connection = peer.connection, credentials, identify = options_.entitlementsForPeer] {
          connection->setEntitlementLookup(identify(**credentials));
        });
  peer.identified = true;
  pump(peer);
}

std::optional<PeerCredentials> Listener::Core::parseCredentials(sd_bus_message* reply) {
  PeerCredentials c;
  bool haveUid = false, havePid = false;
  if (sd_bus_message_enter_container(reply, 'a', "{sv}") <= 0) return std::nullopt;
  while (sd_bus_message_enter_container(reply, 'e', "sv") > 0) {
    const char* key = nullptr;
    if (sd_bus_message_read_basic(reply, 's', &key) <= 0) return std::nullopt;
    std::string_view k = key;
    if (k == "UnixUserID" && sd_bus_message_enter_container(reply, 'v', "u") > 0) {
      uint32_t v = 0;
      haveUid = sd_bus_message_read_basic(reply, 'u', &v) > 0;
      c.uid = v;
      sd_bus_message_exit_container(reply);
    } else if (k == "ProcessID" && sd_bus_message_enter_container(reply, 'v', "u") > 0) {
      uint32_t v = 0;
      havePid = sd_bus_message_read_basic(reply, 'u', &v) > 0;
      c.pid = static_cast<pid_t>(v);
      sd_bus_message_exit_container(reply);
    } else if (k == "LinuxSecurityLabel" && sd_bus_message_enter_container(reply, 'v', "ay") > 0) {
      const void* bytes = nullptr;
      size_t size = 0;
      if (sd_bus_message_read_array(reply, 'y', &bytes, &size) > 0) {
        std::string label(static_cast<const char*>(bytes), size);
        while (!label.empty() && label.back() == '\0') label.pop_back();
        if (!label.empty()) c.label = std::move(label);
      }
      sd_bus_message_exit_container(reply);
    } else if (k == "ProcessFD" && sd_bus_message_enter_container(reply, 'v', "h") > 0) {
      int fd = -1;
      if (sd_bus_message_read_basic(reply, 'h', &fd) > 0 && fd >= 0) c.pidfd.reset(fcntl(fd, F_DUPFD_CLOEXEC, 3));
      sd_bus_message_exit_container(reply);
    } else {
      sd_bus_message_skip(reply, "v");
    }
    sd_bus_message_exit_container(reply);
  }
  if (!haveUid || !havePid) return std::nullopt;
  return c;
}

void Listener::Core::pump(Peer& peer) {
  while (peer.identified && peer.working < options_.maxCallsPerPeer && !peer.backlog.empty()) {
    auto& [invocation, reply] = peer.backlog.front();
    schedule(peer.connection, std::move(invocation), std::move(reply));
    peer.backlog.pop_front();
    ++peer.working;
  }
}

// Runs a call on its peer's queue, with the peer's connection current.
void Listener::Core::schedule(const std::shared_ptr<Connection>& connection, MethodInvocation invocation, Reply reply) {
  connection->queue()->async([connection, invocation = std::move(invocation), reply = std::move(reply)] {
    Connection::CurrentScope scope(connection.get());
    try {
      invocation(reply);
    } catch (const std::exception& e) {
      reply.fail(BusError{kBusErrorFailed, std::string("The operation failed: ") + e.what()});
    }
  });
}

int Listener::Core::onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*) {
  auto* self = static_cast<Core*>(userdata);
  const char *name = nullptr, *oldOwner = nullptr, *newOwner = nullptr;
  if (sd_bus_message_read(m, "sss", &name, &oldOwner, &newOwner) < 0) return 0;
  // A unique name never comes back: its connection ends with it. Work already queued finishes.
  if (name && name[0] == ':' && newOwner && !*newOwner) {
    self->peers_.erase(name);
    self->connectionCount_.store(self->peers_.size());
  }
  return 0;
}

}  // namespace platform

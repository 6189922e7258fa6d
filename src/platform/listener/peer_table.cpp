#include "platform/listener/peer_table.h"

#include <fcntl.h>

#include <cstring>

#include "platform/listener/guarded.h"
#include "platform/listener/listener.h"
#include "platform/log/log.h"

namespace platform {

PeerTable::PeerTable(Listener& owner, EntitlementsForPeer entitlementsForPeer, size_t maxCallsPerPeer)
    : owner_(owner), entitlementsForPeer_(std::move(entitlementsForPeer)), maxCallsPerPeer_(maxCallsPerPeer) {}

int PeerTable::watch(sd_bus* bus) {
  bus_ = bus;
  sd_bus_slot* slot = nullptr;
  int rc = sd_bus_match_signal(bus, &slot, "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                               "NameOwnerChanged", &Guarded<&PeerTable::onNameOwnerChanged>::call, this);
  matchSlot_.reset(slot);
  return rc;
}

// Nothing is recorded when making the entry fails (the delegate may run out of threads or memory),
// so that the peer's next message tries again.
std::shared_ptr<Connection> PeerTable::connectionFor(const std::string& sender) {
  auto it = peers_.find(sender);
  if (it != peers_.end()) return it->second.connection;
  Peer made;
  auto connection = std::make_shared<Connection>(sender);
  std::shared_ptr<ListenerDelegate> delegate = owner_.delegate();
  if (delegate && delegate->listenerShouldAcceptNewConnection(owner_, *connection))
    made.connection = std::move(connection);
  if (made.connection) made.request = std::make_unique<CredentialsRequest>(CredentialsRequest{this, sender});
  Peer& peer = peers_.emplace(sender, std::move(made)).first->second;
  count_.store(peers_.size());
  if (!peer.connection) return nullptr;
  // Asked once, without waiting: the answer comes back to this thread like any other message.
  sd_bus_slot* slot = nullptr;
  int rc = sd_bus_call_method_async(bus_, &slot, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                                    "org.freedesktop.DBus", "GetConnectionCredentials",
                                    &Guarded<&PeerTable::onCredentials>::call, peer.request.get(), "s", sender.c_str());
  peer.credentialsCall.reset(slot);
  if (rc < 0) identify(peer, nullptr, std::string(strerror(-rc)));
  return peer.connection;
}

void PeerTable::enqueue(const std::string& sender, MethodInvocation invocation, Reply reply) {
  auto it = peers_.find(sender);
  if (it == peers_.end()) return;
  it->second.backlog.emplace_back(std::move(invocation), std::move(reply));
  pump(it->second);
}

void PeerTable::finished(const std::string& sender) {
  if (auto it = peers_.find(sender); it != peers_.end()) {
    --it->second.working;
    pump(it->second);
  }
}

int PeerTable::onCredentials(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto* request = static_cast<CredentialsRequest*>(userdata);
  auto it = request->table->peers_.find(request->peer);
  if (it == request->table->peers_.end()) return 0;
  const sd_bus_error* error = sd_bus_message_get_error(reply);
  request->table->identify(it->second, error ? nullptr : reply, error && error->message ? error->message : "");
  return 0;
}

// Bus thread: the peer's identity is worked out first on its own queue (reading /proc may be
// slow), then its waiting calls follow in order. Without credentials it holds no entitlements.
void PeerTable::identify(Peer& peer, sd_bus_message* credentialsReply, const std::string& error) {
  auto credentials = std::make_shared<std::optional<PeerCredentials>>();
  if (credentialsReply) *credentials = parseCredentials(credentialsReply);
  if (!*credentials)
    log(LogLevel::Error, "No credentials for peer %s%s%s: it holds no entitlements", peer.connection->peerName(),
        error.empty() ? "" : ": ", error);
  else if (entitlementsForPeer_)
    peer.connection->queue()->async([connection = peer.connection, credentials, identify = entitlementsForPeer_] {
      connection->setEntitlementLookup(identify(**credentials));
    });
  peer.identified = true;
  pump(peer);
}

namespace {

// The credentials read so far; a peer is known only by both its user id and its process id.
struct CredentialsSeen {
  PeerCredentials credentials;
  bool uid = false;
  bool pid = false;
};

void readUserID(sd_bus_message* reply, CredentialsSeen& seen) {
  uint32_t v = 0;
  seen.uid = sd_bus_message_read_basic(reply, 'u', &v) > 0;
  seen.credentials.uid = v;
}

void readProcessID(sd_bus_message* reply, CredentialsSeen& seen) {
  uint32_t v = 0;
  seen.pid = sd_bus_message_read_basic(reply, 'u', &v) > 0;
  seen.credentials.pid = static_cast<pid_t>(v);
}

// The bus hands the label over with its C string's trailing NUL.
void readSecurityLabel(sd_bus_message* reply, CredentialsSeen& seen) {
  const void* bytes = nullptr;
  size_t size = 0;
  if (sd_bus_message_read_array(reply, 'y', &bytes, &size) <= 0) return;
  std::string label(static_cast<const char*>(bytes), size);
  while (!label.empty() && label.back() == '\0') label.pop_back();
  if (!label.empty()) seen.credentials.label = std::move(label);
}

// The message owns its descriptor: a copy is kept.
void readProcessFD(sd_bus_message* reply, CredentialsSeen& seen) {
  int fd = -1;
  if (sd_bus_message_read_basic(reply, 'h', &fd) > 0 && fd >= 0)
    seen.credentials.pidfd.reset(fcntl(fd, F_DUPFD_CLOEXEC, 3));
}

struct CredentialsKey {
  const char* name;
  const char* type;  // of the variant's value; a value of another type is passed over
  void (*read)(sd_bus_message* reply, CredentialsSeen& seen);
};

const CredentialsKey kCredentialsKeys[] = {
    {"UnixUserID", "u", readUserID},
    {"ProcessID", "u", readProcessID},
    {"LinuxSecurityLabel", "ay", readSecurityLabel},
    {"ProcessFD", "h", readProcessFD},
};

// Reads the variant of one entry when its key is one of ours with the expected type, else skips it.
void readCredentialsValue(sd_bus_message* reply, std::string_view key, CredentialsSeen& seen) {
  for (const CredentialsKey& known : kCredentialsKeys) {
    if (key == known.name && sd_bus_message_enter_container(reply, 'v', known.type) > 0) {
      known.read(reply, seen);
      sd_bus_message_exit_container(reply);
      return;
    }
  }
  sd_bus_message_skip(reply, "v");
}

}  // namespace

std::optional<PeerCredentials> PeerTable::parseCredentials(sd_bus_message* reply) {
  CredentialsSeen seen;
  if (sd_bus_message_enter_container(reply, 'a', "{sv}") <= 0) return std::nullopt;
  while (sd_bus_message_enter_container(reply, 'e', "sv") > 0) {
    const char* key = nullptr;
    if (sd_bus_message_read_basic(reply, 's', &key) <= 0) return std::nullopt;
    readCredentialsValue(reply, key, seen);
    sd_bus_message_exit_container(reply);
  }
  if (!seen.uid || !seen.pid) return std::nullopt;
  return std::move(seen.credentials);
}

void PeerTable::pump(Peer& peer) {
  while (peer.identified && peer.working < maxCallsPerPeer_ && !peer.backlog.empty()) {
    // Out of the backlog and counted first: should scheduling fail, the reply answers for itself
    // and its answer gives the turn back, as any other would.
    auto [invocation, reply] = std::move(peer.backlog.front());
    peer.backlog.pop_front();
    ++peer.working;
    schedule(peer.connection, std::move(invocation), std::move(reply));
  }
}

// Runs a call on its peer's queue, with the peer's connection current.
void PeerTable::schedule(const std::shared_ptr<Connection>& connection, MethodInvocation invocation, Reply reply) {
  connection->queue()->async([connection, invocation = std::move(invocation), reply = std::move(reply)] {
    Connection::CurrentScope scope(connection.get());
    try {
      invocation(reply);
    } catch (const std::exception& e) {
      reply.fail(BusError{kBusErrorFailed, std::string("The operation failed: ") + e.what()});
    }
  });
}

int PeerTable::onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*) {
  auto* self = static_cast<PeerTable*>(userdata);
  const char *name = nullptr, *oldOwner = nullptr, *newOwner = nullptr;
  if (sd_bus_message_read(m, "sss", &name, &oldOwner, &newOwner) < 0) return 0;
  // A unique name never comes back: its connection ends with it. Work already queued finishes.
  if (name && name[0] == ':' && newOwner && !*newOwner) {
    self->peers_.erase(name);
    self->count_.store(self->peers_.size());
  }
  return 0;
}

}  // namespace platform

#include "devserver/connection_tracker.h"

#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

namespace devserver {

// One index for the process: OpenSSL calls freeCallback for it on every SSL object freed.
int ConnectionTracker::trackerIndex() {
  static const int index = SSL_get_ex_new_index(0, nullptr, nullptr, nullptr, &ConnectionTracker::freeCallback);
  return index;
}

ConnectionTracker::ConnectionTracker(std::function<void()> onConnection) : onConnection_(std::move(onConnection)) {}

bool ConnectionTracker::attach(SSL_CTX* ctx) {
  if (trackerIndex() < 0 || SSL_CTX_set_app_data(ctx, this) != 1) {
    return false;
  }
  SSL_CTX_set_info_callback(ctx, &ConnectionTracker::infoCallback);
  return true;
}

void ConnectionTracker::infoCallback(const SSL* ssl, int where, int /*value*/) {
  if ((where & SSL_CB_HANDSHAKE_START) == 0 || SSL_get_ex_data(ssl, trackerIndex()) != nullptr) {
    return;
  }
  auto* tracker = static_cast<ConnectionTracker*>(SSL_CTX_get_app_data(SSL_get_SSL_CTX(ssl)));
  if (tracker != nullptr) {
    // OpenSSL hands the callback a const object; this connection's ex_data is ours to set.
    tracker->add(const_cast<SSL*>(ssl));
  }
}

void ConnectionTracker::freeCallback(void* parent, void* pointer, CRYPTO_EX_DATA*, int, long, void*) {
  if (pointer != nullptr) {
    static_cast<ConnectionTracker*>(pointer)->remove(static_cast<const SSL*>(parent));
  }
}

void ConnectionTracker::add(SSL* ssl) {
  const int fd = SSL_get_fd(ssl);
  if (fd < 0 || SSL_set_ex_data(ssl, trackerIndex(), this) != 1) {
    return;
  }
  // Answers are small and written in pieces: Nagle's algorithm would hold each one back.
  const int on = 1;
  setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
  bool closed = false;
  {
    std::lock_guard lock(mutex_);
    sockets_.emplace(ssl, fd);
    closed = closed_;
  }
  if (closed) {
    ::shutdown(fd, SHUT_RDWR);
  } else if (onConnection_) {
    onConnection_();
  }
}

void ConnectionTracker::remove(const SSL* ssl) {
  std::lock_guard lock(mutex_);
  sockets_.erase(ssl);
}

void ConnectionTracker::closeAll() {
  std::lock_guard lock(mutex_);  // held so that no socket can be closed under us
  closed_ = true;
  for (const auto& [ssl, fd] : sockets_) {
    ::shutdown(fd, SHUT_RDWR);
  }
}

void ConnectionTracker::cut(const SSL* ssl) {
  if (ssl != nullptr) {
    const int fd = SSL_get_fd(ssl);
    if (fd >= 0) {
      ::shutdown(fd, SHUT_RDWR);
    }
  }
}

}  // namespace devserver

// Knows the sockets of a TLS server's live connections, through callbacks on its SSL_CTX: a
// connection is added when its handshake starts and removed when its SSL object is freed (before
// the socket is closed, so a tracked socket is always still open). Every connection gets
// TCP_NODELAY.
//  closeAll  shuts down every live connection and every later one: an idle keep-alive
//            connection would otherwise hold a worker, and so stop(), until its timeout.
//  cut       shuts down one connection's socket at once, without an answer.
// The tracker must outlive every SSL object made from the context. Thread-safe.
#pragma once

#include <openssl/ssl.h>

#include <functional>
#include <mutex>
#include <unordered_map>

namespace devserver {

class ConnectionTracker {
 public:
  // `onConnection` runs (on the connection's thread) for every connection that starts.
  explicit ConnectionTracker(std::function<void()> onConnection = nullptr);
  ConnectionTracker(const ConnectionTracker&) = delete;
  ConnectionTracker& operator=(const ConnectionTracker&) = delete;

  // Returns false if OpenSSL could not register the callbacks.
  bool attach(SSL_CTX* ctx);
  void closeAll();
  static void cut(const SSL* ssl);

 private:
  static int trackerIndex();
  static void infoCallback(const SSL* ssl, int where, int value);
  static void freeCallback(void* parent, void* pointer, CRYPTO_EX_DATA* data, int index, long argl, void* argp);
  void add(SSL* ssl);
  void remove(const SSL* ssl);

  std::function<void()> onConnection_;
  std::mutex mutex_;
  std::unordered_map<const SSL*, int> sockets_;  // guarded by mutex_
  bool closed_ = false;                          // guarded by mutex_
};

}  // namespace devserver

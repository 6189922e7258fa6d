// Counters behind GET /_admin/stats:
//   {"requests": {endpoint name: n, all five present}, "statuses": {"200": n, ...},
//    "verified": n, "rejected": n, "handshakes": n, "connections": n}
// "requests" counts requests to each endpoint path whatever their outcome; "statuses" counts
// the statuses answered outside /_admin (a dropped request has none); "verified" and
// "rejected" count token requests whose signature passed or failed; "handshakes" counts
// associations made; "connections" counts TLS connections accepted. Thread-safe.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <mutex>
#include <nlohmann/json.hpp>

#include "devserver/endpoint.h"

namespace devserver {

class ServerStats {
 public:
  void countRequest(Endpoint endpoint);
  void countStatus(int status);
  void countVerified();
  void countRejected();
  void countHandshake();
  void countConnection();
  void reset();
  nlohmann::json toJSON() const;

 private:
  mutable std::mutex mutex_;
  std::array<uint64_t, kAllEndpoints.size()> requests_{};  // guarded by mutex_, as is the rest
  std::map<int, uint64_t> statuses_;
  uint64_t verified_ = 0;
  uint64_t rejected_ = 0;
  uint64_t handshakes_ = 0;
  uint64_t connections_ = 0;
};

}  // namespace devserver

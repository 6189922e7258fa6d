#include "devserver/server_stats.h"

#include <string>

namespace devserver {

void ServerStats::countRequest(Endpoint endpoint) {
  std::lock_guard lock(mutex_);
  ++requests_[static_cast<std::size_t>(endpoint)];
}

void ServerStats::countStatus(int status) {
  std::lock_guard lock(mutex_);
  ++statuses_[status];
}

void ServerStats::countVerified() {
  std::lock_guard lock(mutex_);
  ++verified_;
}

void ServerStats::countRejected() {
  std::lock_guard lock(mutex_);
  ++rejected_;
}

void ServerStats::countHandshake() {
  std::lock_guard lock(mutex_);
  ++handshakes_;
}

void ServerStats::countConnection() {
  std::lock_guard lock(mutex_);
  ++connections_;
}

void ServerStats::reset() {
  std::lock_guard lock(mutex_);
  requests_.fill(0);
  statuses_.clear();
  verified_ = rejected_ = handshakes_ = connections_ = 0;
}

nlohmann::json ServerStats::toJSON() const {
  std::lock_guard lock(mutex_);
  nlohmann::json requests = nlohmann::json::object();
  for (const Endpoint endpoint : kAllEndpoints) {
    requests[std::string(endpointName(endpoint))] = requests_[static_cast<std::size_t>(endpoint)];
  }
  nlohmann::json statuses = nlohmann::json::object();
  for (const auto& [status, count] : statuses_) {
    statuses[std::to_string(status)] = count;
  }
  return {{"requests", requests},  {"statuses", statuses},      {"verified", verified_},
          {"rejected", rejected_}, {"handshakes", handshakes_}, {"connections", connections_}};
}

}  // namespace devserver

// The fixture of the tests that talk over a bus: a private bus with the echo service on it, and
// helpers to connect clients and to wait for asynchronous answers.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <vector>

#include "client/zlka_client.h"
#include "echo_service.h"
#include "common/private_bus.h"

namespace client_test {

class ClientBusTest : public ::testing::Test {
 protected:
  void SetUp() override {
    bus = std::make_unique<PrivateBus>();
    ASSERT_TRUE(bus->running());
    service = std::make_unique<EchoService>(bus->address());
    ASSERT_TRUE(service->ready());
    client = connect();
    ASSERT_NE(client, nullptr);
  }

  void TearDown() override {
    client.reset();
    service.reset();
    bus.reset();
  }

  std::unique_ptr<zlka_client::ZLKAClient> connect(std::chrono::microseconds timeout = std::chrono::minutes(5)) {
    auto connected = zlka_client::ZLKAClient::connect({.bus = bus->address(), .callTimeout = timeout});
    EXPECT_TRUE(connected.ok()) << (connected.ok() ? "" : connected.error().description());
    return connected.ok() ? std::move(connected).value() : nullptr;
  }

  std::unique_ptr<PrivateBus> bus;
  std::unique_ptr<EchoService> service;
  std::unique_ptr<zlka_client::ZLKAClient> client;
};

// Collects asynchronous answers; wait() returns once `expected` of them have arrived.
template <class T>
class Answers {
 public:
  explicit Answers(size_t expected) : expected_(expected) {}
  std::function<void(zlka_client::Result<T>)> callback() {
    return [this](zlka_client::Result<T> result) {
      std::lock_guard lock(mutex_);
      results_.push_back(std::move(result));
      threads_.push_back(std::this_thread::get_id());
      done_.notify_all();
    };
  }
  void wait() {
    std::unique_lock lock(mutex_);
    done_.wait(lock, [&] { return results_.size() >= expected_; });
  }
  std::vector<zlka_client::Result<T>> results() {
    std::lock_guard lock(mutex_);
    return results_;
  }
  std::vector<std::thread::id> threads() {
    std::lock_guard lock(mutex_);
    return threads_;
  }

 private:
  size_t expected_;
  std::mutex mutex_;
  std::condition_variable done_;
  std::vector<zlka_client::Result<T>> results_;
  std::vector<std::thread::id> threads_;
};

}  // namespace client_test

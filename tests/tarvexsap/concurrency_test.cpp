// Contexts used from several threads at once while handles come and go and the anchor is
// replaced, a teardown racing with a call on the same handle, and the server's replay window
// under parallel submissions. Run under ThreadSanitizer too (label tsan).
#include <gtest/gtest.h>

#include <atomic>
#include <latch>
#include <thread>

#include "tsap_test_support.h"

using namespace tsaptest;
using Status = TarvexSAPServerStatus;

namespace {

class ConcurrencyTest : public TsapTest {};

TEST_F(ConcurrencyTest, ContextsInParallelWhileHandlesComeAndGoAndTheAnchorChanges) {
  const std::string both = pki_.rootPEM + TestPKI("Other").rootPEM;
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 3; ++t) {
    threads.emplace_back([&, id = "SESSION-" + std::to_string(t)] {
      for (int association = 0; association < 3; ++association) {
        Device device;
        failures += !associate(device, *server_, id, pki_.setupDER);
        for (int round = 0; round < 10; ++round) {
          Bytes signature;
          failures += device.sign(bytesOf(id), &signature) != kTarvexSAPOK;
          const auto accepted = server_->verifyRequest(id, signature, bytesOf(id));
          const auto answer = server_->signResponse(id, accepted.seq, bytesOf(id));
          const Bytes response(answer.signature.begin(), answer.signature.end());
          failures += accepted.status != Status::ok || device.verify(response, bytesOf(id)) != kTarvexSAPOK;
        }
      }
    });
  }
  threads.emplace_back([&] {
    for (int i = 0; i < 100; ++i) {
      QVSAPContextOpaque_* handle = nullptr;
      TarvexHWInfo_ hw{};
      failures += TarvexSAPInit(&handle, &hw) != kTarvexSAPOK || TarvexSAPTeardown(handle) != kTarvexSAPOK;
      // Every anchor in turn trusts the setup certificate.
      const std::string& anchor = i % 2 == 0 ? both : pki_.rootPEM;
      const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(anchor.data()), anchor.size(), nullptr};
      failures += TarvexSAPConfigure(&config) != kTarvexSAPOK;
    }
  });
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
}

TEST_F(ConcurrencyTest, TeardownOfAHandleInUse) {
  // Misuse on purpose: one thread keeps signing with a handle that another tears down. Every
  // call must either succeed or see the handle as gone, and never touch freed memory.
  Device device;
  ASSERT_TRUE(associate(device, *server_, "S", pki_.setupDER));
  std::latch signing(1);
  int32_t status = kTarvexSAPOK;
  std::thread user([&] {
    for (int i = 0; i < 1000000 && status == kTarvexSAPOK; ++i) {
      status = device.sign(Bytes(16, 0));
      if (i == 0) signing.count_down();
    }
  });
  signing.wait();
  EXPECT_EQ(TarvexSAPTeardown(device.handle), kTarvexSAPOK);
  user.join();
  EXPECT_EQ(status, kTarvexSAPErrorUnknownHandle);
}

TEST_F(ConcurrencyTest, ServerAcceptsEachSeqOnceUnderParallelSubmission) {
  Device device;
  ASSERT_TRUE(associate(device, *server_, "P", pki_.setupDER));
  std::vector<Bytes> signatures(300);
  for (Bytes& signature : signatures) ASSERT_EQ(device.sign({}, &signature), kTarvexSAPOK);
  // Every thread submits every signature; each must be accepted exactly once overall.
  std::vector<std::atomic<int>> accepted(signatures.size() + 1);
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (const Bytes& signature : signatures) {
        const auto r = server_->verifyRequest("P", signature, {});
        if (r.status == Status::ok) ++accepted.at(r.seq);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  for (uint64_t seq = 1; seq <= signatures.size(); ++seq) EXPECT_EQ(accepted[seq].load(), 1) << "seq " << seq;
}

}  // namespace

// Contexts used from several threads at once while handles come and go and the anchor is
// replaced, a teardown racing with a call on the same handle, and the server's replay window
// under parallel submissions. Run under ThreadSanitizer too (label tsan).
#include "tsap_test_support.h"

#include <gtest/gtest.h>

#include <atomic>
#include <latch>
#include <thread>

using namespace tsaptest;

namespace {

class ConcurrencyTest : public TsapTest {};

TEST_F(ConcurrencyTest, ContextsInParallelWhileHandlesComeAndGoAndTheAnchorChanges) {
    const TestPKI other("Other");
    const std::string both = pki_.rootPEM + other.rootPEM;
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 3; ++t) {
        threads.emplace_back([&, t] {
            const std::string id = "SESSION-" + std::to_string(t);
            for (int association = 0; association < 3; ++association) {
                Device device;
                failures += !associate(device, *server_, id, pki_.setupDER);
                for (int round = 0; round < 10; ++round) {
                    const Bytes body = bytesOf(id + "/" + std::to_string(round));
                    Bytes signature;
                    failures += device.sign(body, &signature) != kTarvexSAPOK;
                    const auto accepted = server_->verifyRequest(id, signature, body);
                    const auto answer = server_->signResponse(id, accepted.seq, body);
                    failures += accepted.status != TarvexSAPServerStatus::ok ||
                                device.verify(Bytes(answer.signature.begin(), answer.signature.end()), body) != 0;
                }
            }
        });
    }
    threads.emplace_back([&] {
        for (int i = 0; i < 100; ++i) {
            QVSAPContextOpaque_ *handle = nullptr;
            TarvexHWInfo_ hw{};
            failures += TarvexSAPInit(&handle, &hw) != kTarvexSAPOK || TarvexSAPTeardown(handle) != kTarvexSAPOK ||
                        TarvexSAPTeardown(handle) != kTarvexSAPErrorUnknownHandle;
            // Every anchor in turn trusts the setup certificate.
            const std::string &anchor = i % 2 == 0 ? both : pki_.rootPEM;
            const TarvexSAPConfig config{reinterpret_cast<const uint8_t *>(anchor.data()), anchor.size(), nullptr};
            failures += TarvexSAPConfigure(&config) != kTarvexSAPOK;
        }
    });
    for (auto &thread : threads) thread.join();
    EXPECT_EQ(failures.load(), 0);
}

TEST_F(ConcurrencyTest, TeardownOfAHandleInUse) {
    // Misuse on purpose: one thread keeps signing with a handle that another tears down. Every
    // call must either succeed or see the handle as gone, and never touch freed memory.
    Device device;
    ASSERT_TRUE(associate(device, *server_, "S", pki_.setupDER));
    std::latch signing(1);
    std::atomic<int> unexpected{0};
    std::atomic<bool> sawGone{false};
    std::thread user([&] {
        const uint8_t body[16] = {};
        for (int i = 0; i < 1000000 && !sawGone; ++i) {
            uint8_t *sig = nullptr;
            uint32_t sigLen = 0;
            const int32_t status = TarvexSAPSign(device.handle, body, sizeof body, &sig, &sigLen);
            std::free(sig);
            if (i == 0) signing.count_down();
            sawGone = status == kTarvexSAPErrorUnknownHandle;
            unexpected += status != kTarvexSAPOK && !sawGone;
        }
    });
    signing.wait();
    EXPECT_EQ(TarvexSAPTeardown(device.handle), kTarvexSAPOK);
    user.join();
    EXPECT_TRUE(sawGone.load());
    EXPECT_EQ(unexpected.load(), 0);
}

TEST_F(ConcurrencyTest, ServerAcceptsEachSeqOnceUnderParallelSubmission) {
    Device device;
    ASSERT_TRUE(associate(device, *server_, "P", pki_.setupDER));
    constexpr uint64_t kSeqs = 300;
    const Bytes body = bytesOf("parallel");
    std::vector<Bytes> signatures(kSeqs);
    for (Bytes &signature : signatures) ASSERT_EQ(device.sign(body, &signature), kTarvexSAPOK);
    // Every thread submits every signature; each must be accepted exactly once overall.
    std::vector<std::atomic<int>> accepted(kSeqs);
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&] {
            for (const Bytes &signature : signatures) {
                const auto r = server_->verifyRequest("P", signature, body);
                if (r.status == TarvexSAPServerStatus::ok) ++accepted[r.seq - 1];
            }
        });
    }
    for (auto &thread : threads) thread.join();
    for (uint64_t i = 0; i < kSeqs; ++i) EXPECT_EQ(accepted[i].load(), 1) << "seq " << i + 1;
}

} // namespace

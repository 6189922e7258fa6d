// Several contexts at once, teardown racing with use, reconfiguration racing with creation, and
// the server's replay window under parallel submissions. Also run under ThreadSanitizer.
#include "tarvexsap/tsap_registry.h"
#include "tsap_reference.h"

#include <gtest/gtest.h>

#include <atomic>
#include <latch>
#include <thread>

using namespace tsaptest;

namespace {

constexpr int kThreads = 4;

class ConcurrencyTest : public ::testing::Test {
protected:
    void SetUp() override {
        pki_ = TestPKI::make("Concurrency");
        pki_.trust();
        server_ = pki_.server();
    }
    TestPKI pki_;
    std::unique_ptr<TarvexSAPServer> server_;
};

TEST_F(ConcurrencyTest, ContextsInParallelThreads) {
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            const std::string id = "SESSION-" + std::to_string(t);
            for (int association = 0; association < 3; ++association) {
                Device device;
                if (!associate(device, *server_, id, pki_.setupDER)) {
                    ++failures;
                    return;
                }
                for (int round = 0; round < 20; ++round) {
                    const Bytes body = bytesOf(id + "/" + std::to_string(round));
                    const auto sig = device.sign(body);
                    const auto accepted = sig ? server_->verifyRequest(id, *sig, body) : TarvexSAPServer::VerifyResult{};
                    const auto answer = server_->signResponse(id, accepted.seq, body);
                    if (accepted.status != TarvexSAPServerStatus::ok ||
                        device.verify(Bytes(answer.signature.begin(), answer.signature.end()), body) != kTarvexSAPOK) {
                        ++failures;
                    }
                }
            }
        });
    }
    for (auto &thread : threads) {
        thread.join();
    }
    EXPECT_EQ(failures.load(), 0);
}

TEST_F(ConcurrencyTest, TeardownRacesWithUseOfOtherHandles) {
    // Long-lived contexts keep working while other threads create and destroy theirs, and
    // while stale handles are torn down again.
    std::vector<std::unique_ptr<Device>> stable;
    for (int i = 0; i < 2; ++i) {
        stable.push_back(std::make_unique<Device>());
        ASSERT_TRUE(associate(*stable.back(), *server_, "STABLE-" + std::to_string(i), pki_.setupDER));
    }
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < 2; ++i) {
        threads.emplace_back([&, i] {
            const std::string id = "STABLE-" + std::to_string(i);
            for (int round = 0; round < 200; ++round) {
                const Bytes body(64, static_cast<uint8_t>(round));
                const auto sig = stable[static_cast<std::size_t>(i)]->sign(body);
                if (!sig || server_->verifyRequest(id, *sig, body).status != TarvexSAPServerStatus::ok) {
                    ++failures;
                }
            }
        });
    }
    for (int i = 0; i < 2; ++i) {
        threads.emplace_back([&] {
            for (int round = 0; round < 100; ++round) {
                QVSAPContextOpaque_ *handle = nullptr;
                TarvexHWInfo_ hw{};
                if (TarvexSAPInit(&handle, &hw) != kTarvexSAPOK || TarvexSAPTeardown(handle) != kTarvexSAPOK ||
                    TarvexSAPTeardown(handle) != kTarvexSAPErrorUnknownHandle) {
                    ++failures;
                }
            }
        });
    }
    for (auto &thread : threads) {
        thread.join();
    }
    EXPECT_EQ(failures.load(), 0);
}

TEST_F(ConcurrencyTest, TeardownOfAHandleInUse) {
    // Misuse the contract on purpose: one thread keeps signing with a handle that another tears
    // down. Every call must either succeed or see the handle as gone; never touch freed memory.
    QVSAPContextOpaque_ *handle = nullptr;
    {
        TarvexHWInfo_ hw{};
        ASSERT_EQ(TarvexSAPInit(&handle, &hw), kTarvexSAPOK);
        uint8_t *out = nullptr;
        uint32_t outLen = 0;
        uint8_t code = 255;
        ASSERT_EQ(TarvexSAPExchange(200, &hw, handle, pki_.setupDER.data(), pki_.setupDER.size(), &out, &outLen, &code),
                  kTarvexSAPOK);
        const auto answer = server_->handshake("S", Bytes(out, out + outLen), std::chrono::seconds(60));
        std::free(out);
        ASSERT_EQ(TarvexSAPExchange(200, &hw, handle, answer.sessionInfo.data(), answer.sessionInfo.size(), &out,
                                    &outLen, &code),
                  kTarvexSAPOK);
    }
    std::latch signing(1);
    std::atomic<int> unexpected{0};
    std::atomic<bool> sawGone{false};
    std::thread user([&] {
        const uint8_t body[16] = {};
        for (int i = 0; i < 1000000; ++i) {
            uint8_t *sig = nullptr;
            uint32_t sigLen = 0;
            const int32_t status = TarvexSAPSign(handle, body, sizeof body, &sig, &sigLen);
            std::free(sig);
            if (i == 0) {
                signing.count_down();
            }
            if (status == kTarvexSAPErrorUnknownHandle) {
                sawGone = true;
                break;
            }
            if (status != kTarvexSAPOK) {
                ++unexpected;
            }
        }
    });
    signing.wait();
    EXPECT_EQ(TarvexSAPTeardown(handle), kTarvexSAPOK);
    user.join();
    EXPECT_TRUE(sawGone.load());
    EXPECT_EQ(unexpected.load(), 0);
}

TEST_F(ConcurrencyTest, ReconfigurationRacesWithContextCreation) {
    const TestPKI other = TestPKI::make("Other");
    std::atomic<int> unexpected{0};
    std::atomic<int> accepted{0};
    std::thread configurer([&] {
        for (int i = 0; i < 100; ++i) {
            (i % 2 == 0 ? other : pki_).trust();
        }
        pki_.trust();
    });
    std::vector<std::thread> users;
    for (int t = 0; t < 2; ++t) {
        users.emplace_back([&] {
            for (int i = 0; i < 50; ++i) {
                Device device;
                const int32_t status = device.exchange(pki_.setupDER).status;
                if (status == kTarvexSAPOK) {
                    ++accepted;
                } else if (status != kTarvexSAPErrorCertificateRejected) {
                    ++unexpected;
                }
            }
        });
    }
    configurer.join();
    for (auto &user : users) {
        user.join();
    }
    EXPECT_EQ(unexpected.load(), 0);
    Device after;
    EXPECT_EQ(after.exchange(pki_.setupDER).status, kTarvexSAPOK);
}

TEST_F(ConcurrencyTest, ServerAcceptsEachSeqOnceUnderParallelSubmission) {
    const auto device = tsapref::handDeviceRequest({});
    const auto answer = server_->handshake("P", device.request, std::chrono::seconds(600));
    tsapref::Keys keys;
    ASSERT_TRUE(tsapref::handDeviceFinish(device, Bytes(answer.sessionInfo.begin(), answer.sessionInfo.end()),
                                          pki_.setup.certificate.get(), keys));
    constexpr uint64_t kSeqs = 300;
    const Bytes body = bytesOf("parallel");
    std::vector<Bytes> signatures;
    for (uint64_t seq = 1; seq <= kSeqs; ++seq) {
        signatures.push_back(tsapref::messageSignature(keys.request, "TSAP1 req", seq, body));
    }
    // Every thread submits every signature; each must be accepted exactly once overall.
    std::vector<std::atomic<int>> acceptedCount(kSeqs);
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&] {
            for (uint64_t i = 0; i < kSeqs; ++i) {
                const auto r = server_->verifyRequest("P", signatures[i], body);
                if (r.status == TarvexSAPServerStatus::ok) {
                    ++acceptedCount[r.seq - 1];
                }
            }
        });
    }
    for (auto &thread : threads) {
        thread.join();
    }
    for (uint64_t i = 0; i < kSeqs; ++i) {
        EXPECT_EQ(acceptedCount[i].load(), 1) << "seq " << i + 1;
    }
}

} // namespace

// Context creation, the hardware identifier, configuration, and the live-handle registry:
// torn-down, foreign and null handles.
#include "tarvexsap/tsap_registry.h"
#include "tsap_reference.h"

#include <gtest/gtest.h>

#include <fstream>
#include <set>

using namespace tsaptest;

namespace {

class HandleLifecycleTest : public ::testing::Test {
protected:
    void SetUp() override {
        pki_ = TestPKI::make("Lifecycle");
        machineID_ = ::testing::TempDir() + "tsap-machine-id-" +
                     ::testing::UnitTest::GetInstance()->current_test_info()->name();
        pki_.trust(machineID_.c_str());
    }
    void TearDown() override { std::remove(machineID_.c_str()); }

    void writeMachineID(const std::string &content) {
        std::ofstream(machineID_, std::ios::binary | std::ios::trunc) << content;
    }

    static Bytes id(const TarvexHWInfo_ &hw) { return Bytes(hw.ID, hw.ID + sizeof hw.ID); }

    TestPKI pki_;
    std::string machineID_;
};

TEST_F(HandleLifecycleTest, EmptyHardwareIDComesFromTheMachineID) {
    const std::string hex = "0123456789abcdef0123456789ABCDEF";
    Bytes expected = tsapref::sha256(tsapref::cat({tsapref::label("TSAP1 hwid"), bytesOf(hex)}));
    expected.resize(20);
    for (const std::string &content : {hex + "\n", hex}) {
        writeMachineID(content);
        Device device;
        ASSERT_EQ(device.initStatus(), kTarvexSAPOK);
        EXPECT_EQ(device.hwInfo().IDLength, 20u);
        EXPECT_EQ(id(device.hwInfo()), expected);
        // And it is what the handshake request carries.
        const ExchangeResult r = device.exchange(pki_.setupDER);
        ASSERT_EQ(r.out.size(), 90u);
        EXPECT_EQ(r.out[5], 20);
        EXPECT_EQ(Bytes(r.out.begin() + 6, r.out.begin() + 26), expected);
    }
}

TEST_F(HandleLifecycleTest, UnusableMachineIDGivesRandomIdentifiers) {
    const std::string hex = "0123456789abcdef0123456789abcdef";
    for (const std::string &content : std::vector<std::string>{hex.substr(1), hex + "0", hex + "\n\n", hex + " ",
                                       "0123456789abcdef0123456789abcdeg", std::string()}) {
        writeMachineID(content);
        Device a;
        Device b;
        ASSERT_EQ(a.initStatus(), kTarvexSAPOK);
        ASSERT_EQ(b.initStatus(), kTarvexSAPOK);
        EXPECT_EQ(a.hwInfo().IDLength, 20u);
        EXPECT_NE(id(a.hwInfo()), id(b.hwInfo())) << "content '" << content << "'";
    }
    std::remove(machineID_.c_str());
    Device a;
    Device b;
    EXPECT_EQ(a.hwInfo().IDLength, 20u);
    EXPECT_NE(id(a.hwInfo()), id(b.hwInfo()));
}

TEST_F(HandleLifecycleTest, GivenHardwareIDIsKeptAndOverlongRefused) {
    TarvexHWInfo_ hw{};
    hw.IDLength = 5;
    std::fill(std::begin(hw.ID), std::end(hw.ID), 0x77);
    Device kept(hw);
    ASSERT_EQ(kept.initStatus(), kTarvexSAPOK);
    EXPECT_EQ(kept.hwInfo().IDLength, 5u);
    EXPECT_EQ(id(kept.hwInfo()), Bytes(20, 0x77));

    QVSAPContextOpaque_ *handle = nullptr;
    hw.IDLength = 21;
    const std::size_t live = tsap::liveContextCount();
    EXPECT_EQ(TarvexSAPInit(&handle, &hw), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(handle, nullptr);
    EXPECT_EQ(tsap::liveContextCount(), live);
    EXPECT_EQ(TarvexSAPInit(nullptr, &hw), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPInit(&handle, nullptr), kTarvexSAPErrorBadArgument);

    // Enlarged after Init: the exchange refuses it rather than read past ID.
    kept.hwInfo().IDLength = 21;
    EXPECT_EQ(kept.exchange(pki_.setupDER).status, kTarvexSAPErrorBadArgument);
    kept.hwInfo().IDLength = 5;
    EXPECT_EQ(kept.exchange(pki_.setupDER).status, kTarvexSAPOK);
}

TEST_F(HandleLifecycleTest, InitNeedsConfiguration) {
    ASSERT_EQ(TarvexSAPConfigure(nullptr), kTarvexSAPOK);
    QVSAPContextOpaque_ *handle = nullptr;
    TarvexHWInfo_ hw{};
    EXPECT_EQ(TarvexSAPInit(&handle, &hw), kTarvexSAPErrorNotConfigured);
    EXPECT_EQ(handle, nullptr);
    pki_.trust(machineID_.c_str());
    EXPECT_EQ(TarvexSAPInit(&handle, &hw), kTarvexSAPOK);
    EXPECT_EQ(TarvexSAPTeardown(handle), kTarvexSAPOK);
}

TEST_F(HandleLifecycleTest, TeardownIsFinalAndRepeatable) {
    auto server = pki_.server();
    QVSAPContextOpaque_ *handle = nullptr;
    TarvexHWInfo_ hw{};
    ASSERT_EQ(TarvexSAPInit(&handle, &hw), kTarvexSAPOK);
    const std::size_t live = tsap::liveContextCount();

    uint8_t *out = nullptr;
    uint32_t outLen = 0;
    uint8_t code = 255;
    ASSERT_EQ(TarvexSAPExchange(200, &hw, handle, pki_.setupDER.data(), pki_.setupDER.size(), &out, &outLen, &code),
              kTarvexSAPOK);
    const auto answer = server->handshake("S", Bytes(out, out + outLen), std::chrono::seconds(60));
    std::free(out);
    ASSERT_EQ(TarvexSAPExchange(200, &hw, handle, answer.sessionInfo.data(), answer.sessionInfo.size(), &out,
                                &outLen, &code),
              kTarvexSAPOK);

    EXPECT_EQ(TarvexSAPTeardown(handle), kTarvexSAPOK);
    EXPECT_EQ(tsap::liveContextCount(), live - 1);
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(TarvexSAPTeardown(handle), kTarvexSAPErrorUnknownHandle);
    }
    uint8_t data[4] = {1, 2, 3, 4};
    uint8_t *sig = nullptr;
    uint32_t sigLen = 0;
    const Bytes fakeSig(40, 0);
    EXPECT_EQ(TarvexSAPSign(handle, data, sizeof data, &sig, &sigLen), kTarvexSAPErrorUnknownHandle);
    EXPECT_EQ(sig, nullptr);
    EXPECT_EQ(TarvexSAPVerify(handle, fakeSig.data(), fakeSig.size(), data, sizeof data),
              kTarvexSAPErrorUnknownHandle);
    EXPECT_EQ(TarvexSAPExchange(200, &hw, handle, answer.sessionInfo.data(), answer.sessionInfo.size(), &out,
                                &outLen, &code),
              kTarvexSAPErrorUnknownHandle);
}

TEST_F(HandleLifecycleTest, ForeignAndNullHandlesAreRefused) {
    Device device;
    // Handles are tokens: the address of real memory is never a live handle.
    int local = 0;
    auto *foreign = reinterpret_cast<QVSAPContextOpaque_ *>(&local);
    uint8_t data[1] = {0};
    uint8_t *sig = nullptr;
    uint32_t sigLen = 0;
    EXPECT_EQ(TarvexSAPTeardown(foreign), kTarvexSAPErrorUnknownHandle);
    EXPECT_EQ(TarvexSAPSign(foreign, data, 1, &sig, &sigLen), kTarvexSAPErrorUnknownHandle);
    EXPECT_EQ(local, 0);
    EXPECT_EQ(TarvexSAPTeardown(nullptr), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPSign(nullptr, data, 1, &sig, &sigLen), kTarvexSAPErrorBadArgument);
    EXPECT_EQ(TarvexSAPVerify(nullptr, data, 1, data, 1), kTarvexSAPErrorBadArgument);
    // A neighbouring token is not live either.
    auto *next = reinterpret_cast<QVSAPContextOpaque_ *>(reinterpret_cast<uintptr_t>(device.handle()) + 1);
    EXPECT_EQ(TarvexSAPTeardown(next), kTarvexSAPErrorUnknownHandle);
    EXPECT_EQ(device.exchange(pki_.setupDER).status, kTarvexSAPOK);
}

TEST_F(HandleLifecycleTest, HandlesAreNeverReused) {
    std::set<QVSAPContextOpaque_ *> seen;
    QVSAPContextOpaque_ *first = nullptr;
    for (int i = 0; i < 200; ++i) {
        QVSAPContextOpaque_ *handle = nullptr;
        TarvexHWInfo_ hw{};
        ASSERT_EQ(TarvexSAPInit(&handle, &hw), kTarvexSAPOK);
        EXPECT_TRUE(seen.insert(handle).second);
        if (first == nullptr) {
            first = handle;
        }
        ASSERT_EQ(TarvexSAPTeardown(handle), kTarvexSAPOK);
    }
    // A stale handle stays dead even after many new contexts.
    EXPECT_EQ(TarvexSAPTeardown(first), kTarvexSAPErrorUnknownHandle);
}

TEST_F(HandleLifecycleTest, TeardownAfterFailedExchange) {
    QVSAPContextOpaque_ *handle = nullptr;
    TarvexHWInfo_ hw{};
    ASSERT_EQ(TarvexSAPInit(&handle, &hw), kTarvexSAPOK);
    uint8_t *out = nullptr;
    uint32_t outLen = 0;
    uint8_t code = 255;
    const Bytes junk = bytesOf("not a certificate");
    EXPECT_EQ(TarvexSAPExchange(200, &hw, handle, junk.data(), junk.size(), &out, &outLen, &code),
              kTarvexSAPErrorCertificateRejected);
    EXPECT_EQ(out, nullptr);
    EXPECT_EQ(outLen, 0u);
    EXPECT_EQ(TarvexSAPTeardown(handle), kTarvexSAPOK);
    EXPECT_EQ(TarvexSAPTeardown(handle), kTarvexSAPErrorUnknownHandle);
}

TEST(StatusNameTest, EveryStatusHasItsOwnName) {
    std::set<std::string> names;
    for (int32_t status = -8; status <= 0; ++status) {
        const std::string name = TarvexSAPStatusName(status);
        EXPECT_NE(name, "unknown") << status;
        EXPECT_TRUE(names.insert(name).second) << name;
    }
    EXPECT_STREQ(TarvexSAPStatusName(-9), "unknown");
    EXPECT_STREQ(TarvexSAPStatusName(1), "unknown");
}

} // namespace

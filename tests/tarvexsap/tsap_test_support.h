// Fixtures of the secure-association tests: a test PKI, a device context that tears itself down
// and owns the buffers the primitives return, a full handshake against a TarvexSAPServer, and
// session infos signed by hand.
#pragma once

#include "tarvexsap/tarvex_sap.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace tsaptest {

using Bytes = std::vector<uint8_t>;

Bytes bytesOf(std::string_view text);
Bytes fromHex(std::string_view hex);
Bytes operator+(Bytes a, const Bytes &b);

// A root with one Ed25519 setup certificate under it.
struct TestPKI {
    explicit TestPKI(const std::string &name, const TarvexSAPValidity &setupValidity = {});
    // Makes this root the device's only trust anchor.
    void trust(const char *machineIDPath = nullptr) const;
    std::unique_ptr<TarvexSAPServer> server(TarvexSAPServer::Clock clock = nullptr) const;

    TarvexSAPCredential root;
    TarvexSAPCredential setup;
    std::string rootPEM;
    Bytes setupDER;
};

struct Exchanged {
    int32_t status = 1;
    uint8_t returnCode = 255; // as it was when the call did not write it
    Bytes out;
    bool outReturned = false;
};

// A device context torn down at the end of its scope.
struct Device {
    explicit Device(const TarvexHWInfo_ &hwInfo = {});
    ~Device();
    Device(const Device &) = delete;
    Device &operator=(const Device &) = delete;

    Exchanged exchange(const Bytes &in, int32_t selector = 200);
    int32_t sign(const Bytes &data, Bytes *signature = nullptr);
    int32_t verify(const Bytes &signature, Bytes data);

    TarvexHWInfo_ hw;
    QVSAPContextOpaque_ *handle = nullptr;
    int32_t initStatus;
};

// Certificate exchange, server handshake and session-info exchange; false (and a test failure)
// when any step does not succeed.
bool associate(Device &device, TarvexSAPServer &server, const std::string &sessionId, const Bytes &certificate);

// `info` (at least 65 bytes) with its first 65 bytes signed by `signer` for `request`, as a
// server holding that key would answer.
Bytes resign(const Bytes &request, Bytes info, EVP_PKEY *signer);

// Each test: the device trusting `pki_`, and a server holding its setup key on a clock the test
// moves by hand.
class TsapTest : public ::testing::Test {
protected:
    void SetUp() override { pki_.trust(); }
    std::shared_ptr<std::chrono::steady_clock::time_point> now_ =
        std::make_shared<std::chrono::steady_clock::time_point>();
    TestPKI pki_{"Test"};
    std::unique_ptr<TarvexSAPServer> server_ = pki_.server([now = now_] { return *now; });
};

} // namespace tsaptest

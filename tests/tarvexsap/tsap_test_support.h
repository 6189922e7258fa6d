// Shared fixtures for the secure-association tests: test PKIs, a device context that tears
// itself down, exchange/sign/verify wrappers that own the returned buffers, and a helper that
// runs a full handshake against a TarvexSAPServer.
#pragma once

#include "tarvexsap/tarvex_sap.h"
#include "tarvexsap/tarvex_sap_certs.h"
#include "tarvexsap/tarvex_sap_server.h"

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace tsaptest {

using Bytes = std::vector<uint8_t>;

Bytes bytesOf(std::string_view text);

// A root with one Ed25519 setup certificate under it.
struct TestPKI {
    TarvexSAPCredential root;
    TarvexSAPCredential setup;
    std::string rootPEM;
    Bytes setupDER;

    static TestPKI make(const std::string &name, const TarvexSAPValidity &setupValidity = {});
    // Makes this root the device's only trust anchor (machine id from `machineIDPath` if given).
    void trust(const char *machineIDPath = nullptr) const;
    std::unique_ptr<TarvexSAPServer> server(TarvexSAPServer::Clock clock = nullptr) const;
};

struct ExchangeResult {
    int32_t status = 1;
    uint8_t returnCode = 255;
    Bytes out;
    bool outReturned = false;
};

// A device context torn down when it goes out of scope.
class Device {
public:
    Device();
    explicit Device(const TarvexHWInfo_ &hw);
    ~Device();
    Device(const Device &) = delete;
    Device &operator=(const Device &) = delete;

    int32_t initStatus() const { return initStatus_; }
    QVSAPContextOpaque_ *handle() const { return handle_; }
    TarvexHWInfo_ &hwInfo() { return hw_; }

    ExchangeResult exchange(const Bytes &in, int32_t selector = 200);
    // Signature bytes, or nullopt with `status` set.
    std::optional<Bytes> sign(const Bytes &data, int32_t *status = nullptr);
    int32_t verify(const Bytes &signature, const Bytes &data);

private:
    TarvexHWInfo_ hw_{};
    QVSAPContextOpaque_ *handle_ = nullptr;
    int32_t initStatus_ = 1;
};

// Runs certificate exchange, server handshake and session-info exchange; fails the current
// test (ADD_FAILURE) and returns false if any step does not succeed.
bool associate(Device &device, TarvexSAPServer &server, const std::string &sessionId, const Bytes &certificate,
               std::chrono::seconds ttl = std::chrono::seconds(3600));

// A clock the test moves by hand.
struct ManualClock {
    std::shared_ptr<std::chrono::steady_clock::time_point> now =
        std::make_shared<std::chrono::steady_clock::time_point>(std::chrono::steady_clock::time_point{});
    TarvexSAPServer::Clock function() const {
        auto shared = now;
        return [shared] { return *shared; };
    }
    void advance(std::chrono::seconds by) const { *now += by; }
};

} // namespace tsaptest

#include "tsap_test_support.h"

#include <gtest/gtest.h>

#include <cstdlib>

namespace tsaptest {

Bytes bytesOf(std::string_view text) {
    return Bytes(text.begin(), text.end());
}

TestPKI TestPKI::make(const std::string &name, const TarvexSAPValidity &setupValidity) {
    TestPKI pki;
    pki.root = TarvexSAPMakeRoot(name + " SAP Root");
    pki.setup = TarvexSAPIssueSetupCertificate(pki.root, name + " Setup", setupValidity);
    pki.rootPEM = TarvexSAPCertToPEM(pki.root.certificate.get());
    pki.setupDER = TarvexSAPCertToDER(pki.setup.certificate.get());
    return pki;
}

void TestPKI::trust(const char *machineIDPath) const {
    const TarvexSAPConfig config{reinterpret_cast<const uint8_t *>(rootPEM.data()), rootPEM.size(), machineIDPath};
    ASSERT_EQ(TarvexSAPConfigure(&config), kTarvexSAPOK);
}

std::unique_ptr<TarvexSAPServer> TestPKI::server(TarvexSAPServer::Clock clock) const {
    return std::make_unique<TarvexSAPServer>(setupDER, setup.key.get(), std::move(clock));
}

Device::Device() : Device(TarvexHWInfo_{}) {}

Device::Device(const TarvexHWInfo_ &hw) : hw_(hw) {
    initStatus_ = TarvexSAPInit(&handle_, &hw_);
}

Device::~Device() {
    if (initStatus_ == kTarvexSAPOK) {
        TarvexSAPTeardown(handle_);
    }
}

ExchangeResult Device::exchange(const Bytes &in, int32_t selector) {
    ExchangeResult result;
    uint8_t *out = nullptr;
    uint32_t outLen = 0;
    result.status =
        TarvexSAPExchange(selector, &hw_, handle_, in.data(), in.size(), &out, &outLen, &result.returnCode);
    if (out != nullptr) {
        result.outReturned = true;
        result.out.assign(out, out + outLen);
        std::free(out);
    }
    return result;
}

std::optional<Bytes> Device::sign(const Bytes &data, int32_t *status) {
    uint8_t *sig = nullptr;
    uint32_t sigLen = 0;
    const int32_t s = TarvexSAPSign(handle_, data.data(), data.size(), &sig, &sigLen);
    if (status != nullptr) {
        *status = s;
    }
    if (sig == nullptr) {
        return std::nullopt;
    }
    Bytes out(sig, sig + sigLen);
    std::free(sig);
    if (s != kTarvexSAPOK) {
        ADD_FAILURE() << "signature buffer returned with failure status " << s;
        return std::nullopt;
    }
    return out;
}

int32_t Device::verify(const Bytes &signature, const Bytes &data) {
    Bytes copy = data; // the primitive may write to it
    return TarvexSAPVerify(handle_, signature.data(), signature.size(), copy.data(), copy.size());
}

bool associate(Device &device, TarvexSAPServer &server, const std::string &sessionId, const Bytes &certificate,
               std::chrono::seconds ttl) {
    if (device.initStatus() != kTarvexSAPOK) {
        ADD_FAILURE() << "init failed: " << device.initStatus();
        return false;
    }
    const ExchangeResult request = device.exchange(certificate);
    if (request.status != kTarvexSAPOK || request.returnCode != 1 || request.out.size() != 90) {
        ADD_FAILURE() << "certificate exchange: status " << request.status << " returnCode "
                      << int(request.returnCode) << " size " << request.out.size();
        return false;
    }
    const auto answer = server.handshake(sessionId, request.out, ttl);
    if (answer.status != TarvexSAPServerStatus::ok) {
        ADD_FAILURE() << "server handshake: " << TarvexSAPServerStatusName(answer.status);
        return false;
    }
    const ExchangeResult done = device.exchange(Bytes(answer.sessionInfo.begin(), answer.sessionInfo.end()));
    if (done.status != kTarvexSAPOK || done.returnCode != 0 || done.outReturned) {
        ADD_FAILURE() << "session-info exchange: status " << done.status << " returnCode " << int(done.returnCode);
        return false;
    }
    return true;
}

} // namespace tsaptest

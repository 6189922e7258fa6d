#include "tsap_test_support.h"

#include "tarvexsap/tsap_crypto.h"
#include "tarvexsap/tsap_protocol.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>

namespace tsaptest {

Bytes bytesOf(std::string_view text) {
    return Bytes(text.begin(), text.end());
}

Bytes operator+(Bytes a, const Bytes &b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

Bytes fromHex(std::string_view hex) {
    Bytes out;
    for (std::size_t i = 0; i + 1 < hex.size(); i += 2) {
        out.push_back(static_cast<uint8_t>(std::stoul(std::string(hex.substr(i, 2)), nullptr, 16)));
    }
    return out;
}

TestPKI::TestPKI(const std::string &name, const TarvexSAPValidity &setupValidity)
    : root(TarvexSAPMakeRoot(name + " SAP Root")),
      setup(TarvexSAPIssueSetupCertificate(root, name + " Setup", setupValidity)),
      rootPEM(TarvexSAPCertToPEM(root.certificate.get())), setupDER(TarvexSAPCertToDER(setup.certificate.get())) {}

void TestPKI::trust(const char *machineIDPath) const {
    const TarvexSAPConfig config{reinterpret_cast<const uint8_t *>(rootPEM.data()), rootPEM.size(), machineIDPath};
    ASSERT_EQ(TarvexSAPConfigure(&config), kTarvexSAPOK);
}

std::unique_ptr<TarvexSAPServer> TestPKI::server(TarvexSAPServer::Clock clock) const {
    return std::make_unique<TarvexSAPServer>(setupDER, setup.key.get(), std::move(clock));
}

Device::Device(const TarvexHWInfo_ &hwInfo) : hw(hwInfo), initStatus(TarvexSAPInit(&handle, &hw)) {}

Device::~Device() {
    if (initStatus == kTarvexSAPOK) {
        TarvexSAPTeardown(handle);
    }
}

Exchanged Device::exchange(const Bytes &in, int32_t selector) {
    Exchanged result;
    uint8_t *out = nullptr;
    uint32_t outLen = 0;
    result.status = TarvexSAPExchange(selector, &hw, handle, in.data(), in.size(), &out, &outLen, &result.returnCode);
    if (out != nullptr) {
        result.outReturned = true;
        result.out.assign(out, out + outLen);
        std::free(out);
    }
    return result;
}

int32_t Device::sign(const Bytes &data, Bytes *signature) {
    uint8_t *sig = nullptr;
    uint32_t sigLen = 0;
    const int32_t status = TarvexSAPSign(handle, data.data(), data.size(), &sig, &sigLen);
    EXPECT_EQ(sig != nullptr, status == kTarvexSAPOK) << "a signature buffer only on success";
    if (signature != nullptr && sig != nullptr) {
        signature->assign(sig, sig + sigLen);
    }
    std::free(sig);
    return status;
}

int32_t Device::verify(const Bytes &signature, Bytes data) {
    return TarvexSAPVerify(handle, signature.data(), signature.size(), data.data(), data.size());
}

bool associate(Device &device, TarvexSAPServer &server, const std::string &sessionId, const Bytes &certificate) {
    const Exchanged request = device.exchange(certificate);
    const auto answer = server.handshake(sessionId, request.out, std::chrono::hours(1));
    const Exchanged done = device.exchange(Bytes(answer.sessionInfo.begin(), answer.sessionInfo.end()));
    const bool associated = device.initStatus == kTarvexSAPOK && request.status == kTarvexSAPOK &&
                            request.returnCode == 1 && request.out.size() == 90 &&
                            answer.status == TarvexSAPServerStatus::ok && done.status == kTarvexSAPOK &&
                            done.returnCode == 0 && !done.outReturned;
    EXPECT_TRUE(associated) << "init " << device.initStatus << ", request " << request.status << ", server "
                            << TarvexSAPServerStatusName(answer.status) << ", session info " << done.status;
    return associated;
}

Bytes resign(const Bytes &request, Bytes info, EVP_PKEY *signer) {
    tsap::RequestBytes requestBytes{};
    tsap::SessionInfoBytes infoBytes{};
    std::copy_n(request.begin(), std::min(request.size(), requestBytes.size()), requestBytes.begin());
    std::copy_n(info.begin(), 65, infoBytes.begin());
    tsap::Digest t{};
    std::array<uint8_t, 64> signature{};
    EXPECT_TRUE(tsap::transcriptHash(requestBytes, infoBytes, t) && tsap::ed25519Sign(signer, t, signature));
    info.resize(65);
    info.insert(info.end(), signature.begin(), signature.end());
    return info;
}

} // namespace tsaptest

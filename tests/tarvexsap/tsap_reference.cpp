#include "tsap_reference.h"

#include <openssl/core_names.h>
#include <openssl/kdf.h>
#include <openssl/rand.h>

#include <stdexcept>

namespace tsapref {
namespace {

void check(bool ok, const char *what) {
    if (!ok) {
        throw std::runtime_error(std::string("reference computation failed: ") + what);
    }
}

Bytes slice(const Bytes &b, std::size_t offset, std::size_t length) {
    check(offset + length <= b.size(), "slice");
    return Bytes(b.begin() + static_cast<std::ptrdiff_t>(offset),
                 b.begin() + static_cast<std::ptrdiff_t>(offset + length));
}

Bytes random(std::size_t n) {
    Bytes b(n);
    check(RAND_bytes(b.data(), static_cast<int>(n)) == 1, "RAND_bytes");
    return b;
}

} // namespace

Bytes cat(std::initializer_list<Bytes> parts) {
    Bytes out;
    for (const Bytes &p : parts) {
        out.insert(out.end(), p.begin(), p.end());
    }
    return out;
}

Bytes label(std::string_view text) {
    return Bytes(text.begin(), text.end());
}

Bytes be64(uint64_t value) {
    Bytes out(8);
    for (int i = 7; i >= 0; --i) {
        out[static_cast<std::size_t>(i)] = static_cast<uint8_t>(value & 0xff);
        value >>= 8;
    }
    return out;
}

Bytes sha256(const Bytes &data) {
    Bytes out(32);
    unsigned int len = 0;
    check(EVP_Digest(data.data(), data.size(), out.data(), &len, EVP_sha256(), nullptr) == 1 && len == 32, "digest");
    return out;
}

Bytes hmacSha256(const Bytes &key, const Bytes &data) {
    Bytes out(32);
    std::size_t len = 0;
    check(EVP_Q_mac(nullptr, "HMAC", nullptr, "SHA256", nullptr, key.data(), key.size(), data.data(), data.size(),
                    out.data(), out.size(), &len) != nullptr &&
              len == 32,
          "hmac");
    return out;
}

Bytes hkdfSha256(const Bytes &ikm, const Bytes &salt, const Bytes &info, std::size_t length) {
    std::unique_ptr<EVP_PKEY_CTX, decltype(&EVP_PKEY_CTX_free)> ctx(EVP_PKEY_CTX_new_id(EVP_PKEY_HKDF, nullptr),
                                                                    &EVP_PKEY_CTX_free);
    Bytes out(length);
    std::size_t len = length;
    check(ctx && EVP_PKEY_derive_init(ctx.get()) == 1 && EVP_PKEY_CTX_set_hkdf_md(ctx.get(), EVP_sha256()) == 1 &&
              EVP_PKEY_CTX_set1_hkdf_salt(ctx.get(), salt.data(), static_cast<int>(salt.size())) == 1 &&
              EVP_PKEY_CTX_set1_hkdf_key(ctx.get(), ikm.data(), static_cast<int>(ikm.size())) == 1 &&
              EVP_PKEY_CTX_add1_hkdf_info(ctx.get(), info.data(), static_cast<int>(info.size())) == 1 &&
              EVP_PKEY_derive(ctx.get(), out.data(), &len) == 1 && len == length,
          "hkdf");
    return out;
}

X25519Pair x25519() {
    X25519Pair pair;
    pair.key.reset(EVP_PKEY_Q_keygen(nullptr, nullptr, "X25519"));
    pair.publicKey.resize(32);
    std::size_t len = 32;
    check(pair.key && EVP_PKEY_get_raw_public_key(pair.key.get(), pair.publicKey.data(), &len) == 1, "x25519");
    return pair;
}

Bytes x25519Shared(EVP_PKEY *privateKey, const Bytes &peerPublic) {
    TarvexSAPKey peer(EVP_PKEY_new_raw_public_key(EVP_PKEY_X25519, nullptr, peerPublic.data(), peerPublic.size()));
    std::unique_ptr<EVP_PKEY_CTX, decltype(&EVP_PKEY_CTX_free)> ctx(EVP_PKEY_CTX_new(privateKey, nullptr),
                                                                    &EVP_PKEY_CTX_free);
    Bytes z(32);
    std::size_t len = 32;
    if (!peer || !ctx || EVP_PKEY_derive_init(ctx.get()) != 1 || EVP_PKEY_derive_set_peer(ctx.get(), peer.get()) != 1 ||
        EVP_PKEY_derive(ctx.get(), z.data(), &len) != 1) {
        return {};
    }
    return z;
}

Bytes ed25519Sign(EVP_PKEY *key, const Bytes &message) {
    std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> ctx(EVP_MD_CTX_new(), &EVP_MD_CTX_free);
    Bytes sig(64);
    std::size_t len = 64;
    check(ctx && EVP_DigestSignInit(ctx.get(), nullptr, nullptr, nullptr, key) == 1 &&
              EVP_DigestSign(ctx.get(), sig.data(), &len, message.data(), message.size()) == 1,
          "ed25519 sign");
    return sig;
}

bool ed25519Verify(EVP_PKEY *key, const Bytes &message, const Bytes &signature) {
    std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> ctx(EVP_MD_CTX_new(), &EVP_MD_CTX_free);
    return ctx && EVP_DigestVerifyInit(ctx.get(), nullptr, nullptr, nullptr, key) == 1 &&
           EVP_DigestVerify(ctx.get(), signature.data(), signature.size(), message.data(), message.size()) == 1;
}

Bytes transcript(const Bytes &request, const Bytes &sessionInfo) {
    return sha256(cat({label("TSAP1 transcript"), request, slice(sessionInfo, 0, 65)}));
}

Keys keys(const Bytes &z, const Bytes &request, const Bytes &sessionInfo) {
    const Bytes salt = cat({slice(request, 58, 32), slice(sessionInfo, 33, 32)});
    const Bytes okm = hkdfSha256(z, salt, cat({label("TSAP1 keys"), transcript(request, sessionInfo)}), 64);
    return Keys{slice(okm, 0, 32), slice(okm, 32, 32)};
}

Bytes messageSignature(const Bytes &key, std::string_view labelText, uint64_t seq, const Bytes &data) {
    return cat({be64(seq), hmacSha256(key, cat({label(labelText), be64(seq), data}))});
}

HandServer handServer(const Bytes &request, EVP_PKEY *signer, uint8_t version, const Bytes *serverPublic) {
    HandServer result;
    X25519Pair ephemeral = x25519();
    const Bytes nonce = random(32);
    const Bytes prefix = cat({Bytes{version}, serverPublic != nullptr ? *serverPublic : ephemeral.publicKey, nonce});
    const Bytes t = sha256(cat({label("TSAP1 transcript"), request, prefix}));
    result.sessionInfo = cat({prefix, ed25519Sign(signer, t)});
    if (serverPublic == nullptr) {
        const Bytes z = x25519Shared(ephemeral.key.get(), slice(request, 26, 32));
        check(!z.empty(), "server derive");
        result.keys = keys(z, request, result.sessionInfo);
    }
    return result;
}

HandDevice handDeviceRequest(const Bytes &hardwareID) {
    HandDevice device;
    device.ephemeral = x25519();
    device.nonce = random(32);
    Bytes id = hardwareID;
    id.resize(20, 0);
    device.request = cat({label("TSAP"), Bytes{1, static_cast<uint8_t>(hardwareID.size())}, id,
                          device.ephemeral.publicKey, device.nonce});
    return device;
}

bool handDeviceFinish(const HandDevice &device, const Bytes &sessionInfo, X509 *setupCertificate, Keys &out) {
    if (sessionInfo.size() != 129 || sessionInfo[0] != 1) {
        return false;
    }
    const Bytes t = transcript(device.request, sessionInfo);
    if (!ed25519Verify(X509_get0_pubkey(setupCertificate), t, slice(sessionInfo, 65, 64))) {
        return false;
    }
    const Bytes z = x25519Shared(device.ephemeral.key.get(), slice(sessionInfo, 1, 32));
    if (z.empty()) {
        return false;
    }
    out = keys(z, device.request, sessionInfo);
    return true;
}

} // namespace tsapref

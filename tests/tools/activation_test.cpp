// The replacement token that activation issues: its DER shape, its signature by the setup key,
// and its use as token data in later requests.
#include <gtest/gtest.h>
#include <openssl/asn1.h>
#include <openssl/evp.h>

#include <chrono>

#include "devserver/activation_token.h"
#include "devserver/strict_base64.h"
#include "devserver_test_support.h"
#include "tarvexsap/tarvex_sap_certs.h"

namespace devtest {
namespace {

using devserver::DevServerOptions;

int64_t unixNow() {
  return std::chrono::duration_cast<std::chrono::seconds>(std::chrono::system_clock::now().time_since_epoch()).count();
}

std::string asText(const ASN1_STRING* string) {
  return std::string(reinterpret_cast<const char*>(ASN1_STRING_get0_data(string)),
                     static_cast<std::size_t>(ASN1_STRING_length(string)));
}

bool ed25519Verifies(EVP_PKEY* key, const Bytes& signature, const Bytes& data) {
  EVP_MD_CTX* ctx = EVP_MD_CTX_new();
  const bool ok = EVP_DigestVerifyInit(ctx, nullptr, nullptr, nullptr, key) == 1 &&
                  EVP_DigestVerify(ctx, signature.data(), signature.size(), data.data(), data.size()) == 1;
  EVP_MD_CTX_free(ctx);
  return ok;
}

class Activation : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(device.associate(*client)); }

  // The two decoded pieces of an activation answer.
  std::pair<Bytes, Bytes> activate(const std::vector<Bytes>& tokens, const std::string& uuid) {
    const auto answer = device.post(*client, "activateAccessory", tokenBody(tokens, uuid));
    if (!answer || answer->status != 200) {
      ADD_FAILURE() << "activation failed: " << (answer ? answer->body : "no answer");
      return {};
    }
    EXPECT_TRUE(device.verifies(*answer));
    const json pieces = json::parse(answer->body).at("tokens");
    EXPECT_EQ(pieces.size(), 2u);
    const auto record = devserver::base64DecodeStrict(pieces.at(0).get<std::string>());
    const auto signature = devserver::base64DecodeStrict(pieces.at(1).get<std::string>());
    EXPECT_TRUE(record && signature);
    return {record.value_or(Bytes{}), signature.value_or(Bytes{})};
  }

  TestServer server;
  std::unique_ptr<httplib::SSLClient> client = server.client();
  Device device{server};
};

TEST_F(Activation, PiecesAreARecordAndItsSignatureByTheSetupKey) {
  const int64_t before = unixNow();
  const auto [record, signature] = activate({sampleToken("accessory-7")}, "4C1F-ACCESSORY-ü");
  const int64_t after = unixNow();
  ASSERT_FALSE(record.empty());

  // Piece 1: SEQUENCE { UTF8String uuid, UTF8String ppid, INTEGER issue time }, nothing after.
  const unsigned char* p = record.data();
  ASN1_SEQUENCE_ANY* sequence = d2i_ASN1_SEQUENCE_ANY(nullptr, &p, static_cast<long>(record.size()));
  ASSERT_NE(sequence, nullptr);
  EXPECT_EQ(p, record.data() + record.size());
  EXPECT_EQ(record[0], 0x30);
  ASSERT_EQ(sk_ASN1_TYPE_num(sequence), 3);
  const ASN1_TYPE* uuid = sk_ASN1_TYPE_value(sequence, 0);
  const ASN1_TYPE* ppid = sk_ASN1_TYPE_value(sequence, 1);
  const ASN1_TYPE* issued = sk_ASN1_TYPE_value(sequence, 2);
  ASSERT_EQ(ASN1_TYPE_get(uuid), V_ASN1_UTF8STRING);
  ASSERT_EQ(ASN1_TYPE_get(ppid), V_ASN1_UTF8STRING);
  ASSERT_EQ(ASN1_TYPE_get(issued), V_ASN1_INTEGER);
  EXPECT_EQ(asText(uuid->value.utf8string), "4C1F-ACCESSORY-ü");
  EXPECT_EQ(asText(ppid->value.utf8string), "PP-0001-ACCESSORY");
  int64_t issuedAt = 0;
  ASSERT_EQ(ASN1_INTEGER_get_int64(&issuedAt, issued->value.integer), 1);
  EXPECT_GE(issuedAt, before);
  EXPECT_LE(issuedAt, after);
  sk_ASN1_TYPE_pop_free(sequence, ASN1_TYPE_free);

  // Piece 2: OCTET STRING with the Ed25519 signature of piece 1, by the served certificate's key.
  const unsigned char* q = signature.data();
  ASN1_OCTET_STRING* octets = d2i_ASN1_OCTET_STRING(nullptr, &q, static_cast<long>(signature.size()));
  ASSERT_NE(octets, nullptr);
  EXPECT_EQ(q, signature.data() + signature.size());
  const Bytes raw(ASN1_STRING_get0_data(octets), ASN1_STRING_get0_data(octets) + ASN1_STRING_length(octets));
  ASN1_OCTET_STRING_free(octets);
  EXPECT_EQ(raw.size(), 64u);
  const TarvexSAPCert setup = TarvexSAPCertFromDER(bytesOf(readText(server.stateDir() / "setup.crt")));
  EVP_PKEY* key = X509_get0_pubkey(setup.get());
  EXPECT_TRUE(ed25519Verifies(key, raw, record));
  Bytes forged = record;
  forged.back() ^= 1;
  EXPECT_FALSE(ed25519Verifies(key, raw, forged));
}

TEST_F(Activation, ConcatenatedPiecesAreTokenDataOfTwoItems) {
  const auto [record, signature] = activate({sampleToken("accessory-8")}, "uuid-8");
  Bytes token = record;
  token.insert(token.end(), signature.begin(), signature.end());

  // Walk the concatenation item by item, as token data is cut on the device.
  std::vector<Bytes> items;
  const unsigned char* p = token.data();
  const unsigned char* end = token.data() + token.size();
  while (p < end && items.size() < 4) {
    const unsigned char* start = p;
    long length = 0;
    int tag = 0;
    int xclass = 0;
    const int flags = ASN1_get_object(&p, &length, &tag, &xclass, end - p);
    ASSERT_EQ(flags & 0x80, 0) << "malformed item";
    p += length;
    ASSERT_LE(p, end);
    items.emplace_back(start, p);
  }
  ASSERT_EQ(items.size(), 2u);
  EXPECT_EQ(items[0], record);
  EXPECT_EQ(items[1], signature);

  // The server recognises its own replacement token.
  const auto decoded = devserver::decodeActivationToken(
      items[0], items[1],
      X509_get0_pubkey(TarvexSAPCertFromDER(bytesOf(readText(server.stateDir() / "setup.crt"))).get()));
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->uuid, "uuid-8");

  // And it can be sent as the token of later requests.
  const auto query = device.post(*client, "queryProductPlan", tokenBody(items, "uuid-8", "en_GB"));
  ASSERT_TRUE(query);
  EXPECT_EQ(query->status, 200) << query->body;
  const auto ack = device.post(*client, "ackAccessory", tokenBody(items, "uuid-8"));
  ASSERT_TRUE(ack);
  EXPECT_EQ(ack->status, 204);
}

TEST_F(Activation, EachActivationIsSignedAfresh) {
  const auto first = activate({sampleToken("a")}, "uuid-a");
  const auto second = activate({sampleToken("a")}, "uuid-b");
  EXPECT_NE(first.first, second.first);    // the uuid is in the record
  EXPECT_NE(first.second, second.second);  // and so in what is signed
}

TEST(ActivationToken, ForeignOrDamagedPiecesAreNotRecognised) {
  const TarvexSAPKey key = TarvexSAPGenerateEd25519Key();
  const TarvexSAPKey other = TarvexSAPGenerateEd25519Key();
  const Bytes record = devserver::encodeActivationRecord({"u", "PP-1", 1700000000});
  const Bytes signature = devserver::signActivationRecord(record, key.get());
  const auto decoded = devserver::decodeActivationToken(record, signature, key.get());
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->ppid, "PP-1");
  EXPECT_EQ(decoded->issuedAt, 1700000000);

  EXPECT_FALSE(devserver::decodeActivationToken(record, signature, other.get()));
  Bytes longer = record;
  longer.push_back(0);
  EXPECT_FALSE(devserver::decodeActivationToken(longer, signature, key.get()));
  EXPECT_FALSE(devserver::decodeActivationToken(signature, record, key.get()));
  const Bytes notARecord = sampleToken("x");
  EXPECT_FALSE(
      devserver::decodeActivationToken(notARecord, devserver::signActivationRecord(notARecord, key.get()), key.get()));
}

}  // namespace
}  // namespace devtest

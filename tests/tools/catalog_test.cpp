// Product plans: the locale rules, the built-in catalogue, catalogue files and their validation.
#include "devserver/catalog.h"

#include <gtest/gtest.h>

#include "devserver/strict_base64.h"
#include "devserver_test_support.h"

namespace devtest {
namespace {

using devserver::Catalog;
using devserver::DevServerOptions;
using devserver::ProductPlan;

json plan(const std::string& ppid, const std::string& defaultLocale, const std::vector<std::string>& locales) {
  json metadata = json::object();
  for (const std::string& locale : locales) {
    metadata[locale] = {{"name", ppid + " in " + locale}};
  }
  return {{"ppid", ppid}, {"default_locale", defaultLocale}, {"metadata", metadata}};
}

ProductPlan planOf(const json& document) { return *Catalog::fromJSON({{"default", document}}, "test").fallback(); }

TEST(CatalogLocale, RequestedThenSameLanguageThenDefault) {
  const ProductPlan p = planOf(plan("PP", "de_DE", {"de_DE", "en_GB", "en_US", "fr_CA", "fr_FR", "zh_Hans_CN"}));
  EXPECT_EQ(p.answerLocale("en_US"), "en_US");  // offered as asked
  EXPECT_EQ(p.answerLocale("zh_Hans_CN"), "zh_Hans_CN");
  EXPECT_EQ(p.answerLocale("fr_BE"), "fr_CA");            // same language, first of them
  EXPECT_EQ(p.answerLocale("zh_Hant_TW"), "zh_Hans_CN");  // language is what precedes the first "_"
  EXPECT_EQ(p.answerLocale("en"), "en_GB");
  EXPECT_EQ(p.answerLocale("ja_JP"), "de_DE");  // nothing close: the default
  EXPECT_EQ(p.answerLocale(""), "de_DE");
  EXPECT_EQ(p.answerLocale("en-US"), "de_DE");  // identifiers are not normalised
  EXPECT_EQ(p.answerLocale("_US"), "de_DE");
}

TEST(CatalogLocale, TheDefaultLeadsAmongLocalesOfTheSameLanguage) {
  const ProductPlan p = planOf(plan("PP", "en_US", {"en_AU", "en_GB", "en_US", "fr_FR"}));
  EXPECT_EQ(p.answerLocale("en_IE"), "en_US");
  EXPECT_EQ(p.answerLocale("en_AU"), "en_AU");
}

TEST(CatalogBuiltIn, OneDefaultPlanInTheAdvertisedLocales) {
  const Catalog catalog = Catalog::builtIn();
  ASSERT_NE(catalog.fallback(), nullptr);
  const ProductPlan& p = *catalog.fallback();
  EXPECT_EQ(p.ppid, "PP-0001-ACCESSORY");
  EXPECT_EQ(p.defaultLocale, "en_US");
  for (const char* locale : {"en_US", "en_GB", "fr_FR", "de_DE", "ja_JP", "zh_Hans_CN"}) {
    ASSERT_TRUE(p.metadata.contains(locale)) << locale;
    for (const char* field : {"name", "description", "model", "color", "features"}) {
      EXPECT_TRUE(p.metadata.at(locale).contains(field)) << locale << " " << field;
    }
  }
  EXPECT_NE(p.metadata.at("fr_FR").at("name"), p.metadata.at("de_DE").at("name"));
  EXPECT_EQ(catalog.mapped(sampleToken("anything")), nullptr);
}

TEST(CatalogFile, InvalidFilesAreRefusedNamingTheProblem) {
  const std::string digest(64, 'a');
  const json good = plan("PP", "en_US", {"en_US"});
  struct Case {
    const char* what;
    std::string text;
    std::string mentions;
  };
  const std::vector<Case> cases = {
      {"not JSON", "{\"default\":", "not valid JSON"},
      {"top level an array", "[]", "top level"},
      {"empty", "{}", "neither"},
      {"unknown member", json{{"default", good}, {"plans", 1}}.dump(), "\"plans\""},
      {"plan not an object", json{{"default", "PP"}}.dump(), "default"},
      {"ppid missing",
       json{{"default", {{"default_locale", "en_US"}, {"metadata", {{"en_US", json::object()}}}}}}.dump(),
       "default.ppid"},
      {"ppid empty",
       json{{"default", {{"ppid", ""}, {"default_locale", "en_US"}, {"metadata", {{"en_US", json::object()}}}}}}.dump(),
       "default.ppid"},
      {"default locale without metadata", json{{"default", plan("PP", "fr_FR", {"en_US"})}}.dump(), "fr_FR"},
      {"metadata entry not an object",
       json{{"default", {{"ppid", "PP"}, {"default_locale", "en_US"}, {"metadata", {{"en_US", "x"}}}}}}.dump(),
       "default.metadata.en_US"},
      {"metadata empty",
       json{{"default", {{"ppid", "PP"}, {"default_locale", "en_US"}, {"metadata", json::object()}}}}.dump(),
       "default.metadata"},
      {"locale key not a locale", json{{"default", plan("PP", "en_US", {"en_US", "en US"})}}.dump(), "en US"},
      {"unknown plan member",
       json{{"default",
             [&] {
               json p = good;
               p["colour"] = 1;
               return p;
             }()}}
           .dump(),
       "colour"},
      {"tokens not an object", json{{"tokens", json::array()}}.dump(), "tokens"},
      {"digest upper case", json{{"tokens", {{std::string(64, 'A'), good}}}}.dump(), "AAAA"},
      {"digest short", json{{"tokens", {{"abc", good}}}}.dump(), "\"abc\""},
      {"bad plan under a digest", json{{"tokens", {{digest, plan("PP", "de_DE", {"en_US"})}}}}.dump(),
       "tokens." + digest},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    TempDir dir;
    const auto file = dir.path() / "catalog.json";
    writeText(file, c.text);
    devserver::DevServer server(catalogOptions(file, dir.path() / "state"));
    const auto error = server.start();
    ASSERT_TRUE(error);
    EXPECT_NE(error->find(file.string()), std::string::npos) << *error;
    EXPECT_NE(error->find(c.mentions), std::string::npos) << *error;
  }
  TempDir dir;
  devserver::DevServer missing(catalogOptions(dir.path() / "absent.json", dir.path() / "state"));
  const auto error = missing.start();
  ASSERT_TRUE(error);
  EXPECT_NE(error->find("absent.json"), std::string::npos);
}

class CatalogServer : public ::testing::Test {
 protected:
  void start(const json& catalog) {
    writeText(dir.path() / "catalog.json", catalog.dump());
    server = std::make_unique<TestServer>(catalogOptions(dir.path() / "catalog.json"));
    client = server->client();
    device = std::make_unique<Device>(*server);
    ASSERT_TRUE(device->associate(*client));
  }
  json query(const std::vector<Bytes>& tokens, const std::string& locale, int expectedStatus = 200) {
    const auto answer = device->post(*client, "queryProductPlan", tokenBody(tokens, "u", locale));
    if (!answer) {
      ADD_FAILURE() << "no answer";
      return {};
    }
    EXPECT_EQ(answer->status, expectedStatus) << answer->body;
    EXPECT_TRUE(device->verifies(*answer));
    return json::parse(answer->body);
  }

  TempDir dir;
  std::unique_ptr<TestServer> server;
  std::unique_ptr<httplib::SSLClient> client;
  std::unique_ptr<Device> device;
};

TEST_F(CatalogServer, TokensMapByTheDigestOfTheirFirstItem) {
  const Bytes gold = sampleToken("gold");
  const Bytes silver = sampleToken("silver");
  start({{"default", plan("PP-DEFAULT", "en_US", {"en_US"})},
         {"tokens",
          {{devserver::sha256Hex(gold), plan("PP-GOLD", "en_US", {"en_US", "fr_FR"})},
           {devserver::sha256Hex(silver), plan("PP-SILVER", "ja_JP", {"ja_JP"})}}}});

  json reply = query({gold}, "fr_FR");
  EXPECT_EQ(reply.at("ppid"), "PP-GOLD");
  EXPECT_EQ(reply.at("locale"), "fr_FR");
  EXPECT_EQ(reply.at("ppid_metadata"), json({{"name", "PP-GOLD in fr_FR"}}));
  reply = query({gold}, "fr_CA");
  EXPECT_EQ(reply.at("locale"), "fr_FR");
  reply = query({silver, gold}, "de_DE");  // only the first item counts
  EXPECT_EQ(reply.at("ppid"), "PP-SILVER");
  EXPECT_EQ(reply.at("locale"), "ja_JP");
  reply = query({sampleToken("bronze"), gold}, "en_US");
  EXPECT_EQ(reply.at("ppid"), "PP-DEFAULT");

  // A replacement token keeps the plan it was issued for.
  const auto activation = device->post(*client, "activateAccessory", tokenBody({silver}, "u"));
  ASSERT_TRUE(activation);
  ASSERT_EQ(activation->status, 200);
  std::vector<Bytes> replacement;
  const json pieces = json::parse(activation->body);
  for (const auto& piece : pieces.at("tokens")) {
    replacement.push_back(*devserver::base64DecodeStrict(piece.get<std::string>()));
  }
  EXPECT_EQ(query(replacement, "ja_JP").at("ppid"), "PP-SILVER");
}

TEST_F(CatalogServer, WithoutADefaultUnknownTokensAre404AndSigned) {
  const Bytes known = sampleToken("known");
  start({{"tokens", {{devserver::sha256Hex(known), plan("PP-KNOWN", "en_US", {"en_US"})}}}});
  EXPECT_EQ(query({known}, "en_US").at("ppid"), "PP-KNOWN");
  EXPECT_EQ(query({sampleToken("stranger")}, "en_US", 404), json({{"error", "unknown token"}}));
  const auto activation = device->post(*client, "activateAccessory", tokenBody({sampleToken("stranger")}, "u"));
  ASSERT_TRUE(activation);
  EXPECT_EQ(activation->status, 404);
  EXPECT_TRUE(device->verifies(*activation));
}

}  // namespace
}  // namespace devtest

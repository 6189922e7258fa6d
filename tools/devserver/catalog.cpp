#include "devserver/catalog.h"

#include <openssl/evp.h>

#include <cctype>
#include <fstream>
#include <sstream>

namespace devserver {

using nlohmann::json;

namespace {

// Every text here is vendor-neutral demo content; the keys are the same in every locale.
constexpr const char* kBuiltInPlan = R"json({
  "ppid": "PP-0001-ACCESSORY",
  "default_locale": "en_US",
  "metadata": {
    "en_US": {"name": "Accessory Hub Dock", "description": "A compact dock that connects accessories to the hub.",
              "model": "AHD-100", "color": "Graphite",
              "features": ["Wireless pairing", "Fast charging", "Firmware updates"]},
    "en_GB": {"name": "Accessory Hub Dock", "description": "A compact dock that connects accessories to the hub.",
              "model": "AHD-100", "color": "Graphite grey",
              "features": ["Wireless pairing", "Fast charging", "Firmware updates"]},
    "fr_FR": {"name": "Station d'accessoires", "description": "Une station compacte qui relie les accessoires au hub.",
              "model": "AHD-100", "color": "Graphite",
              "features": ["Appairage sans fil", "Charge rapide", "Mises à jour du micrologiciel"]},
    "de_DE": {"name": "Zubehör-Dock", "description": "Ein kompaktes Dock, das Zubehör mit dem Hub verbindet.",
              "model": "AHD-100", "color": "Graphit",
              "features": ["Kabellose Kopplung", "Schnellladen", "Firmware-Aktualisierungen"]},
    "es_ES": {"name": "Base de accesorios", "description": "Una base compacta que conecta los accesorios al hub.",
              "model": "AHD-100", "color": "Grafito",
              "features": ["Emparejamiento inalámbrico", "Carga rápida", "Actualizaciones de firmware"]},
    "ja_JP": {"name": "アクセサリドック", "description": "アクセサリをハブに接続するコンパクトなドック。",
              "model": "AHD-100", "color": "グラファイト",
              "features": ["ワイヤレスペアリング", "急速充電", "ファームウェアアップデート"]},
    "zh_Hans_CN": {"name": "配件扩展坞", "description": "将配件连接到集线器的紧凑型扩展坞。",
                   "model": "AHD-100", "color": "石墨色",
                   "features": ["无线配对", "快速充电", "固件更新"]}
  }
})json";

std::string_view language(std::string_view locale) { return locale.substr(0, locale.find('_')); }

// Letters, digits and single inner underscores, starting with a letter: "en", "zh_Hans_CN".
bool plausibleLocale(std::string_view locale) {
  if (locale.empty() || !std::isalpha(static_cast<unsigned char>(locale.front())) || locale.back() == '_' ||
      locale.find("__") != std::string_view::npos) {
    return false;
  }
  for (const char c : locale) {
    if (!std::isalnum(static_cast<unsigned char>(c)) && c != '_') {
      return false;
    }
  }
  return true;
}

bool isLowerHexDigest(std::string_view key) {
  if (key.size() != 64) {
    return false;
  }
  for (const char c : key) {
    if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'))) {
      return false;
    }
  }
  return true;
}

class Reader {
 public:
  explicit Reader(std::string origin) : origin_(std::move(origin)) {}

  platform::Failure fail(const std::string& where, const std::string& what) const {
    return platform::Failure{origin_ + ": " + (where.empty() ? "" : where + ": ") + what};
  }

  platform::Result<ProductPlan> plan(const json& value, const std::string& where) const {
    if (!value.is_object()) {
      return fail(where, "a plan must be an object with \"ppid\", \"default_locale\" and \"metadata\"");
    }
    for (const auto& [key, member] : value.items()) {
      if (key != "ppid" && key != "default_locale" && key != "metadata") {
        return fail(where, "unknown member \"" + key + "\"");
      }
    }
    ProductPlan plan;
    const auto ppid = value.find("ppid");
    if (ppid == value.end() || !ppid->is_string() || ppid->get_ref<const std::string&>().empty()) {
      return fail(where + ".ppid", "must be a non-empty string");
    }
    plan.ppid = ppid->get<std::string>();
    const auto metadata = value.find("metadata");
    if (metadata == value.end() || !metadata->is_object() || metadata->empty()) {
      return fail(where + ".metadata", "must be an object mapping at least one locale to an object");
    }
    for (const auto& [locale, entry] : metadata->items()) {
      if (!plausibleLocale(locale)) {
        return fail(where + ".metadata", "\"" + locale + "\" is not a locale identifier such as \"en_US\"");
      }
      if (!entry.is_object()) {
        return fail(where + ".metadata." + locale, "must be an object");
      }
    }
    plan.metadata = *metadata;
    const auto defaultLocale = value.find("default_locale");
    if (defaultLocale == value.end() || !defaultLocale->is_string()) {
      return fail(where + ".default_locale", "must be a string");
    }
    plan.defaultLocale = defaultLocale->get<std::string>();
    if (!plan.metadata.contains(plan.defaultLocale)) {
      return fail(where + ".default_locale", "\"" + plan.defaultLocale + "\" has no entry in metadata");
    }
    return plan;
  }

 private:
  std::string origin_;
};

}  // namespace

std::string ProductPlan::answerLocale(std::string_view requested) const {
  const std::string wanted(requested);
  if (metadata.contains(wanted)) {
    return wanted;
  }
  const std::string_view lang = language(requested);
  if (!lang.empty()) {
    if (language(defaultLocale) == lang) {
      return defaultLocale;
    }
    for (const auto& [locale, entry] : metadata.items()) {  // sorted: the choice is stable
      if (language(locale) == lang) {
        return locale;
      }
    }
  }
  return defaultLocale;
}

platform::Result<Catalog> Catalog::builtIn() {
  return fromJSON(json{{"default", json::parse(kBuiltInPlan, nullptr, false)}}, "built-in catalog");
}

platform::Result<Catalog> Catalog::fromFile(const std::filesystem::path& file) {
  const std::string origin = "catalog " + file.string();
  std::ifstream in(file, std::ios::binary);
  if (!in) {
    return platform::Failure{origin + ": cannot be opened"};
  }
  std::ostringstream text;
  text << in.rdbuf();
  if (!in) {
    return platform::Failure{origin + ": cannot be read"};
  }
  json document;
  // The throwing parse is the one whose error says where the text goes wrong.
  try {
    document = json::parse(std::move(text).str());
  } catch (const json::parse_error& error) {
    return platform::Failure{origin + ": not valid JSON (" + error.what() + ")"};
  }
  return fromJSON(document, origin);
}

platform::Result<Catalog> Catalog::fromJSON(const json& document, const std::string& origin) {
  const Reader reader(origin);
  if (!document.is_object()) {
    return reader.fail("", "the top level must be an object with \"default\" and/or \"tokens\"");
  }
  Catalog catalog;
  for (const auto& [key, member] : document.items()) {
    if (key != "default" && key != "tokens") {
      return reader.fail("", "unknown member \"" + key + "\" (expected \"default\" and/or \"tokens\")");
    }
  }
  if (const auto fallback = document.find("default"); fallback != document.end()) {
    platform::Result<ProductPlan> plan = reader.plan(*fallback, "default");
    if (!plan) {
      return platform::Failure{plan.error()};
    }
    catalog.fallback_ = *std::move(plan);
  }
  if (const auto tokens = document.find("tokens"); tokens != document.end()) {
    if (!tokens->is_object()) {
      return reader.fail("tokens", "must be an object mapping SHA-256 hex digests to plans");
    }
    for (const auto& [digest, entry] : tokens->items()) {
      if (!isLowerHexDigest(digest)) {
        return reader.fail("tokens", "\"" + digest + "\" is not a lower-case hex SHA-256 digest (64 characters)");
      }
      platform::Result<ProductPlan> plan = reader.plan(entry, "tokens." + digest);
      if (!plan) {
        return platform::Failure{plan.error()};
      }
      catalog.byDigest_.emplace(digest, *std::move(plan));
    }
  }
  if (!catalog.fallback_ && catalog.byDigest_.empty()) {
    return reader.fail("", "neither a \"default\" plan nor any entry in \"tokens\"");
  }
  return catalog;
}

platform::Result<const ProductPlan*> Catalog::mapped(std::span<const uint8_t> firstTokenItem) const {
  const platform::Result<std::string> digest = sha256Hex(firstTokenItem);
  if (!digest) {
    return platform::Failure{digest.error()};
  }
  const auto it = byDigest_.find(*digest);
  return it == byDigest_.end() ? nullptr : &it->second;
}

const ProductPlan* Catalog::withPPID(std::string_view ppid) const {
  if (fallback_ && fallback_->ppid == ppid) {
    return &*fallback_;
  }
  for (const auto& [digest, plan] : byDigest_) {
    if (plan.ppid == ppid) {
      return &plan;
    }
  }
  return nullptr;
}

platform::Result<std::string> sha256Hex(std::span<const uint8_t> bytes) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  if (EVP_Digest(bytes.data(), bytes.size(), digest, &length, EVP_sha256(), nullptr) != 1) {
    return platform::Failure{"SHA-256 failed"};
  }
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  out.reserve(2 * length);
  for (unsigned int i = 0; i < length; ++i) {
    out += kHex[digest[i] >> 4];
    out += kHex[digest[i] & 0xf];
  }
  return out;
}

}  // namespace devserver

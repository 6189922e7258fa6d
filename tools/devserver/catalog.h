// Product plans and the tokens they belong to.
//
// A plan is {"ppid": string, "default_locale": string, "metadata": {locale: object}}; locale
// identifiers are ICU style ("en_US", "zh_Hans_CN") and the default locale must have metadata.
// A catalogue file is {"default": PLAN (optional), "tokens": {"<sha256 hex>": PLAN}} where the
// key is the lower-case hex SHA-256 of a token's first item. builtIn() has one default plan,
// "PP-0001-ACCESSORY", in several locales, so that any token gets an answer.
// Loading fails naming the file and the member that is wrong. Immutable once made, so it may be
// read from any thread.
#pragma once

#include <cstdint>
#include <filesystem>
#include <nlohmann/json.hpp>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>

#include "platform/values/result.h"

namespace devserver {

struct ProductPlan {
  std::string ppid;
  std::string defaultLocale;
  nlohmann::json metadata;  // object: locale identifier -> object

  // The requested locale if the plan has metadata for it; else one of the plan's locales with
  // the same language (the part before the first "_"), the default locale first among them;
  // else the default locale.
  std::string answerLocale(std::string_view requested) const;
};

class Catalog {
 public:
  // builtIn returns the built-in catalogue; it fails only if its own text were wrong.
  static platform::Result<Catalog> builtIn();
  // fromFile returns the catalogue in `file`, or a failure naming the file and what is wrong.
  static platform::Result<Catalog> fromFile(const std::filesystem::path& file);
  // fromJSON returns the catalogue `document` describes, or a failure naming `origin` and the
  // member that is wrong.
  static platform::Result<Catalog> fromJSON(const nlohmann::json& document, const std::string& origin);

  // The plan mapped to this first token item, or null; a failure when it cannot be digested.
  platform::Result<const ProductPlan*> mapped(std::span<const uint8_t> firstTokenItem) const;
  // The first plan (default first) with this ppid, or null.
  const ProductPlan* withPPID(std::string_view ppid) const;
  // The plan of tokens that are not mapped, or null when there is none.
  const ProductPlan* fallback() const { return fallback_ ? &*fallback_ : nullptr; }
  std::size_t mappedCount() const { return byDigest_.size(); }

 private:
  std::optional<ProductPlan> fallback_;
  std::unordered_map<std::string, ProductPlan> byDigest_;
};

// sha256Hex returns the lower-case hex SHA-256 of `bytes`, or a failure when the crypto library fails.
platform::Result<std::string> sha256Hex(std::span<const uint8_t> bytes);

}  // namespace devserver

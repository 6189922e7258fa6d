#include "support/entitlements.h"

namespace Entitlements {

bool hasEntitlement(const platform::Connection& connection, std::string_view entitlement) {
  std::optional<platform::Value> value = connection.valueForEntitlement(entitlement);
  if (!value) return false;
  if (value->isNumber()) return value->boolValue();
  return value->isArray() || value->isDictionary();
}

bool hasCategory(const platform::Connection& connection, std::string_view category, std::string_view entitlement) {
  std::optional<platform::Value> value = connection.valueForEntitlement(entitlement);
  if (!value) return false;
  if (const platform::Array* array = value->array()) {
    for (const platform::Value& item : *array)
      if (item.string() && *item.string() == category) return true;
    return false;
  }
  if (value->isDictionary()) {
    const platform::Value* entry = value->find(category);
    return entry && entry->isNumber() && entry->boolValue();
  }
  return false;
}

}  // namespace Entitlements

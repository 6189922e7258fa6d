#include "client/request_encoding.h"

#include <cerrno>
#include <cstdint>
#include <limits>

namespace zlka_client {

namespace {

std::optional<std::string> checkValue(const platform::Value& value, const std::string& path, int depth) {
  using platform::Value;
  if (value.isNull()) return path + " is null, and a null cannot be sent";
  if (const auto* opaque = value.opaque()) return path + " is a " + opaque->kind + ", which cannot be sent";
  if (const std::string* s = value.string()) {
    if (!isBusString(*s)) return path + " is not a UTF-8 string without NUL characters";
    return std::nullopt;
  }
  const platform::Array* array = value.array();
  const platform::Dictionary* dictionary = value.dictionary();
  if (!array && !dictionary) return std::nullopt;
  if (depth > kMaxRequestInfoDepth)
    return path + " is nested too deeply (more than " + std::to_string(kMaxRequestInfoDepth) + " levels)";
  if (array) {
    for (size_t i = 0; i < array->size(); ++i)
      if (auto reason = checkValue((*array)[i], path + "[" + std::to_string(i) + "]", depth + 1)) return reason;
  } else {
    for (const auto& [key, member] : *dictionary) {
      if (!isBusString(key)) return path + " has a key that is not a UTF-8 string without NUL characters";
      if (auto reason = checkValue(member, path + "." + key, depth + 1)) return reason;
    }
  }
  return std::nullopt;
}

std::optional<std::string> checkString(const std::optional<std::string>& text, const char* name) {
  if (text && !isBusString(*text)) return std::string(name) + " is not a UTF-8 string without NUL characters";
  return std::nullopt;
}

int openEntry(sd_bus_message* m, const char* key, const char* contents) {
  int r = sd_bus_message_open_container(m, SD_BUS_TYPE_DICT_ENTRY, "sv");
  if (r >= 0) r = sd_bus_message_append_basic(m, SD_BUS_TYPE_STRING, key);
  if (r >= 0) r = sd_bus_message_open_container(m, SD_BUS_TYPE_VARIANT, contents);
  return r;
}

int closeEntry(sd_bus_message* m) {
  int r = sd_bus_message_close_container(m);  // the variant
  return r < 0 ? r : sd_bus_message_close_container(m);
}

int appendBytes(sd_bus_message* m, const platform::Data& data) {
  static const uint8_t none = 0;  // sd-bus wants a pointer even for no bytes
  return sd_bus_message_append_array(m, 'y', data.bytes() ? data.bytes() : &none, data.length());
}

int appendStringEntry(sd_bus_message* m, const char* key, const std::optional<std::string>& text) {
  if (!text) return 0;
  int r = openEntry(m, key, "s");
  if (r >= 0) r = sd_bus_message_append_basic(m, SD_BUS_TYPE_STRING, text->c_str());
  return r < 0 ? r : closeEntry(m);
}

int appendCommon(sd_bus_message* m, const std::optional<platform::Data>& token,
                 const std::optional<std::string>& uuid) {
  int r = 0;
  if (token) {
    r = openEntry(m, "token", "ay");
    if (r >= 0) r = appendBytes(m, *token);
    if (r >= 0) r = closeEntry(m);
  }
  return r < 0 ? r : appendStringEntry(m, "uuid", uuid);
}

template <class T>
int appendBasicVariant(sd_bus_message* m, char type, const T& v) {
  const char contents[2] = {type, '\0'};
  int r = sd_bus_message_open_container(m, SD_BUS_TYPE_VARIANT, contents);
  if (r >= 0) r = sd_bus_message_append_basic(m, type, &v);
  return r < 0 ? r : sd_bus_message_close_container(m);
}

// The daemon reads numbers by value, so the signed type is used whenever it can hold the number.
int appendUnsignedVariant(sd_bus_message* m, uint64_t u) {
  if (u <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
    return appendBasicVariant(m, 'x', static_cast<int64_t>(u));
  return appendBasicVariant(m, 't', u);
}

// Wraps what `append` writes in a variant of type `contents`.
template <class Append>
int inVariant(sd_bus_message* m, const char* contents, Append append) {
  int r;
  if ((r = sd_bus_message_open_container(m, SD_BUS_TYPE_VARIANT, contents)) < 0) return r;
  if ((r = append()) < 0) return r;
  return sd_bus_message_close_container(m);
}

// JSON arrays hold any mix of values: an array of variants.
int appendArray(sd_bus_message* m, const platform::Array& array) {
  int r;
  if ((r = sd_bus_message_open_container(m, SD_BUS_TYPE_ARRAY, "v")) < 0) return r;
  for (const platform::Value& item : array)
    if ((r = appendVariant(m, item)) < 0) return r;
  return sd_bus_message_close_container(m);
}

}  // namespace

std::optional<std::string> unsendableReason(const platform::Value& value, const std::string& path) {
  return checkValue(value, path, 1);
}

std::optional<std::string> unsendableReason(const TokenArguments& arguments) {
  return checkString(arguments.uuid, "uuid");
}

std::optional<std::string> unsendableReason(const MetadataArguments& arguments) {
  if (auto reason = checkString(arguments.uuid, "uuid")) return reason;
  if (auto reason = checkString(arguments.requestedLocale, "requestedLocale")) return reason;
  if (arguments.requestInfo) return unsendableReason(platform::Value(*arguments.requestInfo), "requestInfo");
  return std::nullopt;
}

int appendVariant(sd_bus_message* m, const platform::Value& value) {
  if (value.isBool()) return appendBasicVariant<int>(m, 'b', value.boolValue() ? 1 : 0);
  if (const int64_t* i = value.integer()) return appendBasicVariant(m, 'x', *i);
  if (const uint64_t* u = value.unsignedInteger()) return appendUnsignedVariant(m, *u);
  if (const double* d = value.real()) return appendBasicVariant(m, 'd', *d);
  if (const std::string* s = value.string())
    return inVariant(m, "s", [&] { return sd_bus_message_append_basic(m, SD_BUS_TYPE_STRING, s->c_str()); });
  if (const platform::Data* data = value.data()) return inVariant(m, "ay", [&] { return appendBytes(m, *data); });
  if (const platform::Array* array = value.array()) return inVariant(m, "av", [&] { return appendArray(m, *array); });
  if (const platform::Dictionary* dictionary = value.dictionary())
    return inVariant(m, "a{sv}", [&] { return appendDictionary(m, *dictionary); });
  return -EINVAL;  // null and opaque values have no bus form
}

int appendDictionary(sd_bus_message* m, const platform::Dictionary& dictionary) {
  int r = sd_bus_message_open_container(m, SD_BUS_TYPE_ARRAY, "{sv}");
  for (auto it = dictionary.begin(); r >= 0 && it != dictionary.end(); ++it) {
    if ((r = sd_bus_message_open_container(m, SD_BUS_TYPE_DICT_ENTRY, "sv")) < 0) break;
    if ((r = sd_bus_message_append_basic(m, SD_BUS_TYPE_STRING, it->first.c_str())) < 0) break;
    if ((r = appendVariant(m, it->second)) < 0) break;
    r = sd_bus_message_close_container(m);
  }
  return r < 0 ? r : sd_bus_message_close_container(m);
}

int appendArguments(sd_bus_message* m, const TokenArguments& arguments) {
  int r = sd_bus_message_open_container(m, SD_BUS_TYPE_ARRAY, "{sv}");
  if (r >= 0) r = appendCommon(m, arguments.token, arguments.uuid);
  return r < 0 ? r : sd_bus_message_close_container(m);
}

int appendArguments(sd_bus_message* m, const MetadataArguments& arguments) {
  int r = sd_bus_message_open_container(m, SD_BUS_TYPE_ARRAY, "{sv}");
  if (r >= 0) r = appendCommon(m, arguments.token, arguments.uuid);
  if (r >= 0) r = appendStringEntry(m, "requestedLocale", arguments.requestedLocale);
  if (r >= 0 && arguments.requestInfo) {
    r = openEntry(m, "requestInfo", "a{sv}");
    if (r >= 0) r = appendDictionary(m, *arguments.requestInfo);
    if (r >= 0) r = closeEntry(m);
  }
  return r < 0 ? r : sd_bus_message_close_container(m);
}

}  // namespace zlka_client

#include "platform/bus_values.h"

#include <cerrno>
#include <cstring>
#include <set>

namespace platform {

namespace {

constexpr int kMaxDepth = 64;  // the bus itself allows no deeper nesting

template <class T>
int readInteger(sd_bus_message* m, char type, Value& out) {
  T v{};
  int r = sd_bus_message_read_basic(m, type, &v);
  if (r > 0) out = Value(v);
  return r;
}

int readValue(sd_bus_message* m, Value& out, int depth);

int readArray(sd_bus_message* m, const char* contents, Value& out, int depth) {
  int r;
  if (std::string_view(contents) == "y") {
    const void* bytes = nullptr;
    size_t size = 0;
    if ((r = sd_bus_message_read_array(m, 'y', &bytes, &size)) < 0) return r;
    out = Value(Data(bytes, size));
    return 1;
  }
  if ((r = sd_bus_message_enter_container(m, 'a', contents)) < 0) return r;
  if (contents[0] == '{') {
    std::string entry(contents + 1, std::string_view(contents).size() - 2);
    bool stringKeys = contents[1] == 's' || contents[1] == 'o' || contents[1] == 'g';
    Dictionary dictionary;
    while ((r = sd_bus_message_enter_container(m, 'e', entry.c_str())) > 0) {
      Value key, value;
      if ((r = readValue(m, key, depth + 1)) < 0 || (r = readValue(m, value, depth + 1)) < 0) return r;
      if ((r = sd_bus_message_exit_container(m)) < 0) return r;
      if (stringKeys) dictionary.insert_or_assign(*key.string(), std::move(value));
    }
    if (r < 0) return r;
    if (stringKeys)
      out = Value(std::move(dictionary));
    else
      out = Value(Opaque{"dictionary with " + std::string(1, contents[1]) + " keys"});
  } else {
    Array array;
    while ((r = sd_bus_message_at_end(m, 0)) == 0) {
      Value item;
      if ((r = readValue(m, item, depth + 1)) < 0) return r;
      array.push_back(std::move(item));
    }
    if (r < 0) return r;
    out = Value(std::move(array));
  }
  return sd_bus_message_exit_container(m) < 0 ? -EBADMSG : 1;
}

int readValue(sd_bus_message* m, Value& out, int depth) {
  if (depth > kMaxDepth) return -ELOOP;
  char type = 0;
  const char* contents = nullptr;
  int r = sd_bus_message_peek_type(m, &type, &contents);
  if (r <= 0) return r < 0 ? r : -EBADMSG;
  switch (type) {
    case 'y':
      return readInteger<uint8_t>(m, type, out);
    case 'n':
      return readInteger<int16_t>(m, type, out);
    case 'q':
      return readInteger<uint16_t>(m, type, out);
    case 'i':
      return readInteger<int32_t>(m, type, out);
    case 'u':
      return readInteger<uint32_t>(m, type, out);
    case 'x':
      return readInteger<int64_t>(m, type, out);
    case 't':
      return readInteger<uint64_t>(m, type, out);
    case 'b': {
      int v = 0;
      if ((r = sd_bus_message_read_basic(m, 'b', &v)) > 0) out = Value(v != 0);
      return r;
    }
    case 'd': {
      double v = 0;
      if ((r = sd_bus_message_read_basic(m, 'd', &v)) > 0) out = Value(v);
      return r;
    }
    case 's':
    case 'o':
    case 'g': {
      const char* v = nullptr;
      if ((r = sd_bus_message_read_basic(m, type, &v)) > 0) out = Value(std::string(v ? v : ""));
      return r;
    }
    case 'h': {
      int fd = -1;
      if ((r = sd_bus_message_read_basic(m, 'h', &fd)) > 0) out = Value(Opaque{"file descriptor"});
      return r;
    }
    case 'v': {
      if ((r = sd_bus_message_enter_container(m, 'v', contents)) < 0) return r;
      if ((r = readValue(m, out, depth + 1)) < 0) return r;
      return sd_bus_message_exit_container(m) < 0 ? -EBADMSG : 1;
    }
    case 'r': {
      if ((r = sd_bus_message_enter_container(m, 'r', contents)) < 0) return r;
      Array fields;
      while ((r = sd_bus_message_at_end(m, 0)) == 0) {
        Value field;
        if ((r = readValue(m, field, depth + 1)) < 0) return r;
        fields.push_back(std::move(field));
      }
      if (r < 0) return r;
      out = Value(std::move(fields));
      return sd_bus_message_exit_container(m) < 0 ? -EBADMSG : 1;
    }
    case 'a':
      return readArray(m, contents, out, depth);
    default:
      return -EBADMSG;
  }
}

// Whether the value at the start of the current variant is longer than `maximum` bytes; the
// variant is read from its start again afterwards. An unreadable value is left to the reader.
bool isLongerThan(sd_bus_message* m, const std::string& signature, size_t maximum) {
  size_t length = 0;
  if (signature == "ay") {
    const void* bytes = nullptr;
    if (sd_bus_message_read_array(m, 'y', &bytes, &length) < 0) length = 0;
  } else if (signature == "s") {
    const char* text = nullptr;
    if (sd_bus_message_read_basic(m, 's', &text) > 0 && text) length = std::strlen(text);
  }
  sd_bus_message_rewind(m, 0);
  return length > maximum;
}

}  // namespace

int readBusValue(sd_bus_message* message, Value& out) { return readValue(message, out, 0); }

std::optional<BusError> readKnownDictionary(sd_bus_message* m, const std::map<std::string, BusKey>& keys,
                                            const BusDictionaryReader& take) {
  auto malformed = [] {
    return BusError{kBusErrorInvalidArgs, "The argument must be a dictionary of string keys to variants (a{sv})."};
  };
  if (sd_bus_message_enter_container(m, 'a', "{sv}") <= 0) return malformed();
  std::set<std::string> seen;
  int r;
  while ((r = sd_bus_message_enter_container(m, 'e', "sv")) > 0) {
    const char* rawKey = nullptr;
    if (sd_bus_message_read_basic(m, 's', &rawKey) <= 0) return malformed();
    std::string key = rawKey ? rawKey : "";
    auto expected = keys.find(key);
    if (expected == keys.end()) return BusError{kBusErrorInvalidArgs, "Unknown key '" + key + "'."};
    if (!seen.insert(key).second) return BusError{kBusErrorInvalidArgs, "Key '" + key + "' is given twice."};
    const BusKey& wanted = expected->second;
    char type = 0;
    const char* contents = nullptr;
    if (sd_bus_message_peek_type(m, &type, &contents) <= 0 || type != 'v' || !contents || wanted.signature != contents)
      return BusError{kBusErrorInvalidArgs, "Key '" + key + "' must hold a value of type " + wanted.signature + "."};
    if (sd_bus_message_enter_container(m, 'v', contents) <= 0)
      return BusError{kBusErrorInvalidArgs, "The value of key '" + key + "' could not be read."};
    if (wanted.maximumLength && isLongerThan(m, wanted.signature, wanted.maximumLength))
      return BusError{kBusErrorInvalidArgs,
                      "Key '" + key + "' must hold at most " + std::to_string(wanted.maximumLength) + " bytes."};
    if (take(key, m) < 0 || sd_bus_message_exit_container(m) < 0)
      return BusError{kBusErrorInvalidArgs, "The value of key '" + key + "' could not be read."};
    if (sd_bus_message_exit_container(m) < 0) return malformed();
  }
  if (r < 0 || sd_bus_message_exit_container(m) < 0) return malformed();
  return std::nullopt;
}

bool isBusString(std::string_view text) {
  size_t i = 0;
  while (i < text.size()) {
    auto byte = [&](size_t k) { return static_cast<unsigned char>(text[k]); };
    unsigned char c = byte(i);
    if (c == 0) return false;
    if (c < 0x80) {
      ++i;
      continue;
    }
    size_t length = 0;
    uint32_t cp = 0;
    if (c >= 0xC2 && c <= 0xDF) {
      length = 2;
      cp = c & 0x1F;
    } else if (c >= 0xE0 && c <= 0xEF) {
      length = 3;
      cp = c & 0x0F;
    } else if (c >= 0xF0 && c <= 0xF4) {
      length = 4;
      cp = c & 0x07;
    } else {
      return false;
    }
    if (i + length > text.size()) return false;
    for (size_t k = 1; k < length; ++k) {
      if ((byte(i + k) & 0xC0) != 0x80) return false;
      cp = (cp << 6) | (byte(i + k) & 0x3F);
    }
    // Overlong forms, UTF-16 surrogates and code points beyond U+10FFFF.
    if ((length == 3 && cp < 0x800) || (length == 4 && (cp < 0x10000 || cp > 0x10FFFF)) ||
        (cp >= 0xD800 && cp <= 0xDFFF))
      return false;
    i += length;
  }
  return true;
}

}  // namespace platform

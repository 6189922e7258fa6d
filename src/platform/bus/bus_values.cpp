#include "platform/bus/bus_values.h"

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

int exitContainer(sd_bus_message* m) { return sd_bus_message_exit_container(m) < 0 ? -EBADMSG : 1; }

// Reads values up to the end of the open container into `items`: >0 at its end, <0 on error.
int readItems(sd_bus_message* m, Array& items, int depth) {
  int r;
  while ((r = sd_bus_message_at_end(m, 0)) == 0) {
    Value item;
    if ((r = readValue(m, item, depth + 1)) < 0) return r;
    items.push_back(std::move(item));
  }
  return r;
}

int readBytes(sd_bus_message* m, Value& out) {
  const void* bytes = nullptr;
  size_t size = 0;
  if (int r = sd_bus_message_read_array(m, 'y', &bytes, &size); r < 0) return r;
  out = Value(Data(bytes, size));
  return 1;
}

// The entries of an open dictionary array. JSON keys are strings: a dictionary with other keys is
// read through (so that the message stays well-formed) and kept only as a placeholder.
int readDictionary(sd_bus_message* m, const char* contents, Value& out, int depth) {
  std::string entry(contents + 1, std::string_view(contents).size() - 2);
  bool stringKeys = contents[1] == 's' || contents[1] == 'o' || contents[1] == 'g';
  Dictionary dictionary;
  int r;
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
  return 1;
}

int readList(sd_bus_message* m, Value& out, int depth) {
  Array array;
  if (int r = readItems(m, array, depth); r < 0) return r;
  out = Value(std::move(array));
  return 1;
}

int readArray(sd_bus_message* m, const char* contents, Value& out, int depth) {
  if (std::string_view(contents) == "y") return readBytes(m, out);
  int r;
  if ((r = sd_bus_message_enter_container(m, 'a', contents)) < 0) return r;
  r = contents[0] == '{' ? readDictionary(m, contents, out, depth) : readList(m, out, depth);
  if (r < 0) return r;
  return exitContainer(m);
}

// Structs map to arrays of their fields.
int readStruct(sd_bus_message* m, const char* contents, Value& out, int depth) {
  int r;
  if ((r = sd_bus_message_enter_container(m, 'r', contents)) < 0) return r;
  Array fields;
  if ((r = readItems(m, fields, depth)) < 0) return r;
  out = Value(std::move(fields));
  return exitContainer(m);
}

int readVariant(sd_bus_message* m, const char* contents, Value& out, int depth) {
  int r;
  if ((r = sd_bus_message_enter_container(m, 'v', contents)) < 0) return r;
  if ((r = readValue(m, out, depth + 1)) < 0) return r;
  return exitContainer(m);
}

// A value of a basic type; file descriptors are kept only as a placeholder JSON cannot hold.
int readBasic(sd_bus_message* m, char type, Value& out) {
  int r;
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
    default:
      return -EBADMSG;
  }
}

int readValue(sd_bus_message* m, Value& out, int depth) {
  if (depth > kMaxDepth) return -ELOOP;
  char type = 0;
  const char* contents = nullptr;
  int r = sd_bus_message_peek_type(m, &type, &contents);
  if (r <= 0) return r < 0 ? r : -EBADMSG;
  switch (type) {
    case 'v':
      return readVariant(m, contents, out, depth);
    case 'r':
      return readStruct(m, contents, out, depth);
    case 'a':
      return readArray(m, contents, out, depth);
    default:
      return readBasic(m, type, out);
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

struct Utf8Lead {
  size_t length;  // of the whole sequence; 0 when the byte starts none
  uint32_t bits;  // of the code point that it carries
};

Utf8Lead utf8Lead(unsigned char c) {
  if (c >= 0xC2 && c <= 0xDF) return {2, c & 0x1Fu};
  if (c >= 0xE0 && c <= 0xEF) return {3, c & 0x0Fu};
  if (c >= 0xF0 && c <= 0xF4) return {4, c & 0x07u};
  return {0, 0};
}

// The length of the well-formed multi-byte UTF-8 sequence at text[i], 0 when there is none.
size_t utf8SequenceLength(std::string_view text, size_t i) {
  const Utf8Lead lead = utf8Lead(static_cast<unsigned char>(text[i]));
  if (lead.length == 0 || i + lead.length > text.size()) return 0;
  uint32_t cp = lead.bits;
  for (size_t k = 1; k < lead.length; ++k) {
    const auto c = static_cast<unsigned char>(text[i + k]);
    if ((c & 0xC0) != 0x80) return 0;
    cp = (cp << 6) | (c & 0x3F);
  }
  // Overlong forms, UTF-16 surrogates and code points beyond U+10FFFF.
  if ((lead.length == 3 && cp < 0x800) || (lead.length == 4 && (cp < 0x10000 || cp > 0x10FFFF)) ||
      (cp >= 0xD800 && cp <= 0xDFFF))
    return 0;
  return lead.length;
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
    const auto c = static_cast<unsigned char>(text[i]);
    if (c == 0) return false;
    const size_t length = c < 0x80 ? 1 : utf8SequenceLength(text, i);
    if (length == 0) return false;
    i += length;
  }
  return true;
}

}  // namespace platform

#include "wire_text.h"

#include <cinttypes>
#include <cstdio>
#include <stdexcept>

namespace client_test {

namespace {

void check(int r) {
  if (r < 0) throw std::runtime_error("malformed message");
}

template <class T>
std::string basic(sd_bus_message* m, char type, const char* format) {
  T v{};
  check(sd_bus_message_read_basic(m, type, &v));
  char buffer[64];
  std::snprintf(buffer, sizeof buffer, format, v);
  return std::string(1, type) + ":" + buffer;
}

std::string value(sd_bus_message* m);

std::string items(sd_bus_message* m) {
  std::string out;
  while (sd_bus_message_at_end(m, 0) == 0) {
    if (!out.empty()) out += ",";
    out += value(m);
  }
  return out;
}

std::string value(sd_bus_message* m) {
  char type = 0;
  const char* contents = nullptr;
  check(sd_bus_message_peek_type(m, &type, &contents));
  switch (type) {
    case 'y': return basic<uint8_t>(m, type, "%u");
    case 'n': return basic<int16_t>(m, type, "%d");
    case 'q': return basic<uint16_t>(m, type, "%u");
    case 'i': return basic<int32_t>(m, type, "%" PRId32);
    case 'u': return basic<uint32_t>(m, type, "%" PRIu32);
    case 'x': return basic<int64_t>(m, type, "%" PRId64);
    case 't': return basic<uint64_t>(m, type, "%" PRIu64);
    case 'd': return basic<double>(m, type, "%.17g");
    case 'b': {
      int v = 0;
      check(sd_bus_message_read_basic(m, 'b', &v));
      return v ? "b:true" : "b:false";
    }
    case 's':
    case 'o':
    case 'g': {
      const char* v = nullptr;
      check(sd_bus_message_read_basic(m, type, &v));
      return std::string(1, type) + ":\"" + v + "\"";
    }
    case 'v': {
      check(sd_bus_message_enter_container(m, 'v', contents));
      std::string inner = value(m);
      check(sd_bus_message_exit_container(m));
      return "<" + inner + ">";
    }
    case 'a': {
      if (std::string_view(contents) == "y") {
        const void* bytes = nullptr;
        size_t size = 0;
        check(sd_bus_message_read_array(m, 'y', &bytes, &size));
        std::string hex;
        for (size_t i = 0; i < size; ++i) {
          char pair[3];
          std::snprintf(pair, sizeof pair, "%02x", static_cast<const uint8_t*>(bytes)[i]);
          hex += pair;
        }
        return "ay:" + hex;
      }
      std::string signature = contents;
      check(sd_bus_message_enter_container(m, 'a', contents));
      std::string out = "a" + signature + "[" + items(m) + "]";
      check(sd_bus_message_exit_container(m));
      return out;
    }
    case 'e': {
      check(sd_bus_message_enter_container(m, 'e', contents));
      std::string key = value(m);
      std::string member = value(m);
      check(sd_bus_message_exit_container(m));
      return key + "=" + member;
    }
    case 'r': {
      check(sd_bus_message_enter_container(m, 'r', contents));
      std::string out = "(" + items(m) + ")";
      check(sd_bus_message_exit_container(m));
      return out;
    }
    default: throw std::runtime_error(std::string("unexpected type ") + type);
  }
}

}  // namespace

std::string wireText(sd_bus_message* m) {
  std::string out;
  try {
    while (sd_bus_message_at_end(m, 1) == 0) {
      if (!out.empty()) out += " ";
      out += value(m);
    }
  } catch (const std::exception& e) {
    out += "<" + std::string(e.what()) + ">";
  }
  return out;
}

}  // namespace client_test

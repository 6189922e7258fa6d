// The D-Bus decoder of the three operations on messages built from the input: an a{sv} of any keys
// holding values of any type, nested. The decoder must accept exactly the dictionaries whose keys
// the operation takes, each once, with its type and size, and hand the operation what was sent.
#include <fuzzer/FuzzedDataProvider.h>
#include <sys/socket.h>

#include <cstdio>
#include <cstdlib>
#include <map>
#include <set>
#include <string>

#include "network/zlka_network_protocol.h"
#include "platform/bus/bus_values.h"
#include "platform/bus/handles.h"
#include "service/zlka_network_bus_interface.h"

using platform::Data;
using platform::Dictionary;
using platform::Value;

namespace {

constexpr size_t kMaximumToken = 64 * 1024;
constexpr int kMaximumDepth = 5;

struct Arguments {
  bool called = false;
  std::optional<Data> token;
  std::optional<std::string> uuid;
  std::optional<platform::Locale> locale;
  std::optional<Dictionary> requestInfo;
};

// Records what the decoder hands over and never answers.
class Recorder final : public ZLKANetworkProtocol {
 public:
  Arguments seen;
  void requestMetadataForToken(const std::optional<Data>& token, const std::optional<std::string>& uuid,
                               const std::optional<platform::Locale>& locale,
                               const std::optional<Dictionary>& requestInfo, ZLKAMetadataReply) override {
    seen = {true, token, uuid, locale, requestInfo};
  }
  void requestActivationForToken(const std::optional<Data>& token, const std::optional<std::string>& uuid,
                                 ZLKAActivationReply) override {
    seen = {true, token, uuid, std::nullopt, std::nullopt};
  }
  void confirmActivationForToken(const std::optional<Data>& token, const std::optional<std::string>& uuid,
                                 ZLKAConfirmationReply) override {
    seen = {true, token, uuid, std::nullopt, std::nullopt};
  }
};

void fail(int line) {
  std::fprintf(stderr, "property broken at line %d\n", line);
  std::abort();
}
#define CHECK(condition) ((condition) ? void() : fail(__LINE__))

std::string busString(FuzzedDataProvider& in) {
  std::string s = in.ConsumeRandomLengthString(24);
  if (platform::isBusString(s)) return s;
  std::string ascii;
  for (char c : s)
    if (c > 0) ascii += c;
  return ascii;
}

constexpr char kBasic[] = "ynqiuxtbdsog";

std::string signature(FuzzedDataProvider& in, int depth) {
  int pick = in.ConsumeIntegralInRange(0, depth >= kMaximumDepth ? 0 : 4);
  switch (pick) {
    case 1:
      return "v";
    case 2:
      return "a" + signature(in, depth + 1);
    case 3:
      return std::string("a{") + in.PickValueInArray({'s', 'y', 'o', 'x'}) + signature(in, depth + 1) + "}";
    case 4:
      return "(" + signature(in, depth + 1) + signature(in, depth + 1) + ")";
    default:
      return std::string(1, kBasic[in.ConsumeIntegralInRange<size_t>(0, sizeof kBasic - 2)]);
  }
}

// Appends one value of `sig` (a complete single type, at sig[at]) and returns what the decoder should
// read back; `at` moves past the type.
Value append(sd_bus_message* m, const std::string& sig, size_t& at, FuzzedDataProvider& in, int depth);

Value appendBasic(sd_bus_message* m, char type, FuzzedDataProvider& in) {
  auto put = [&](auto v) {
    CHECK(sd_bus_message_append_basic(m, type, &v) >= 0);
    return Value(v);
  };
  switch (type) {
    case 'y':
      return put(in.ConsumeIntegral<uint8_t>());
    case 'n':
      return put(in.ConsumeIntegral<int16_t>());
    case 'q':
      return put(in.ConsumeIntegral<uint16_t>());
    case 'i':
      return put(in.ConsumeIntegral<int32_t>());
    case 'u':
      return put(in.ConsumeIntegral<uint32_t>());
    case 'x':
      return put(in.ConsumeIntegral<int64_t>());
    case 't':
      return put(in.ConsumeIntegral<uint64_t>());
    case 'd':
      return put(static_cast<double>(in.ConsumeIntegral<int32_t>()) / 8);
    case 'b': {
      int b = in.ConsumeBool();
      CHECK(sd_bus_message_append_basic(m, 'b', &b) >= 0);
      return Value(b != 0);
    }
    default: {
      std::string s = type == 'o'   ? "/p" + std::to_string(in.ConsumeIntegral<uint8_t>())
                      : type == 'g' ? signature(in, kMaximumDepth - 1)
                                    : busString(in);
      CHECK(sd_bus_message_append_basic(m, type, s.c_str()) >= 0);
      return Value(s);
    }
  }
}

// The end of the complete type that starts at sig[at].
size_t typeEnd(const std::string& sig, size_t at) {
  if (sig[at] == 'a') return typeEnd(sig, at + 1);
  if (sig[at] != '(' && sig[at] != '{') return at + 1;
  size_t i = at + 1;
  while (sig[i] != ')' && sig[i] != '}') i = typeEnd(sig, i);
  return i + 1;
}

Value append(sd_bus_message* m, const std::string& sig, size_t& at, FuzzedDataProvider& in, int depth) {
  char type = sig[at];
  size_t end = typeEnd(sig, at);
  std::string contents = sig.substr(at + 1, end - at - 1);
  at = end;
  if (type == 'v') {
    std::string inner = signature(in, depth + 1);
    CHECK(sd_bus_message_open_container(m, 'v', inner.c_str()) >= 0);
    size_t i = 0;
    Value v = append(m, inner, i, in, depth + 1);
    CHECK(sd_bus_message_close_container(m) >= 0);
    return v;
  }
  if (type == '(') {
    contents.pop_back();
    CHECK(sd_bus_message_open_container(m, 'r', contents.c_str()) >= 0);
    platform::Array fields;
    for (size_t i = 0; i < contents.size();) fields.push_back(append(m, contents, i, in, depth + 1));
    CHECK(sd_bus_message_close_container(m) >= 0);
    return Value(std::move(fields));
  }
  if (type != 'a') return appendBasic(m, type, in);
  if (contents == "y") {
    std::string bytes = in.ConsumeRandomLengthString(32);
    CHECK(sd_bus_message_append_array(m, 'y', bytes.data(), bytes.size()) >= 0);
    return Value(Data(bytes.data(), bytes.size()));
  }
  CHECK(sd_bus_message_open_container(m, 'a', contents.c_str()) >= 0);
  size_t count = in.ConsumeIntegralInRange(0, 3);
  platform::Array items;
  Dictionary entries;
  bool dictionary = contents[0] == '{';
  std::string entry = dictionary ? contents.substr(1, contents.size() - 2) : contents;
  for (size_t n = 0; n < count; ++n) {
    size_t i = 0;
    if (!dictionary) {
      items.push_back(append(m, entry, i, in, depth + 1));
      continue;
    }
    CHECK(sd_bus_message_open_container(m, 'e', entry.c_str()) >= 0);
    Value key = append(m, entry, i, in, depth + 1);
    Value value = append(m, entry, i, in, depth + 1);
    CHECK(sd_bus_message_close_container(m) >= 0);
    if (key.string()) entries.insert_or_assign(*key.string(), std::move(value));
  }
  CHECK(sd_bus_message_close_container(m) >= 0);
  if (!dictionary) return Value(std::move(items));
  if (entry[0] == 's' || entry[0] == 'o') return Value(std::move(entries));
  return Value(platform::Opaque{"dictionary with " + entry.substr(0, 1) + " keys"});
}

sd_bus* scratchBus() {
  // A message needs a bus that has started; one end of a socket pair is enough to build on.
  static platform::BusPtr bus = [] {
    int fds[2];
    CHECK(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, fds) == 0);
    sd_bus* b = nullptr;
    CHECK(sd_bus_new(&b) >= 0 && sd_bus_set_fd(b, fds[0], fds[0]) >= 0 && sd_bus_start(b) >= 0);
    return platform::BusPtr(b);
  }();
  return bus.get();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  FuzzedDataProvider in(data, size);
  const auto& methods = ZLKANetworkProtocolInterface()->methods;
  const auto& method = methods[in.ConsumeIntegralInRange<size_t>(0, methods.size() - 1)];
  const bool metadata = method.name == "RequestMetadataForToken";
  std::map<std::string, std::string> takes = {{"token", "ay"}, {"uuid", "s"}};
  if (metadata) takes.insert({{"requestedLocale", "s"}, {"requestInfo", "a{sv}"}});

  sd_bus_message* raw = nullptr;
  CHECK(sd_bus_message_new_method_call(scratchBus(), &raw, "a.b", "/a", "a.b", method.name.c_str()) >= 0);
  platform::BusMessagePtr message(raw);
  CHECK(sd_bus_message_open_container(raw, 'a', "{sv}") >= 0);
  Arguments sent;
  bool acceptable = true;
  std::set<std::string> keys;
  for (size_t n = in.ConsumeIntegralInRange(0, 5); n > 0; --n) {
    std::string key =
        in.ConsumeBool() ? busString(in) : in.PickValueInArray({"token", "uuid", "requestedLocale", "requestInfo"});
    auto wanted = takes.find(key);
    std::string sig = wanted != takes.end() && in.ConsumeBool() ? wanted->second : signature(in, 0);
    acceptable = acceptable && wanted != takes.end() && wanted->second == sig && keys.insert(key).second;
    CHECK(sd_bus_message_open_container(raw, 'e', "sv") >= 0 &&
          sd_bus_message_append_basic(raw, 's', key.c_str()) >= 0 &&
          sd_bus_message_open_container(raw, 'v', sig.c_str()) >= 0);
    if (key == "token" && sig == "ay" && in.ConsumeBool()) {
      // A token at and past its bound, in place of a short one.
      std::string bytes(kMaximumToken + in.ConsumeIntegralInRange(0, 1), 'T');
      Data big(bytes.data(), bytes.size());
      CHECK(sd_bus_message_append_array(raw, 'y', big.bytes(), big.length()) >= 0);
      acceptable = acceptable && big.length() <= kMaximumToken;
      sent.token = big;
    } else {
      size_t at = 0;
      Value v = append(raw, sig, at, in, 0);
      if (key == "token" && v.data()) sent.token = *v.data();
      if (key == "uuid" && v.string()) sent.uuid = *v.string();
      if (key == "requestedLocale" && v.string()) sent.locale = platform::Locale(*v.string());
      if (key == "requestInfo" && v.dictionary()) sent.requestInfo = *v.dictionary();
    }
    CHECK(sd_bus_message_close_container(raw) >= 0 && sd_bus_message_close_container(raw) >= 0);
  }
  CHECK(sd_bus_message_close_container(raw) >= 0 && sd_bus_message_seal(raw, 1, 0) >= 0 &&
        sd_bus_message_rewind(raw, 1) >= 0);

  auto recorder = std::make_shared<Recorder>();
  platform::DecodedCall decoded = method.decode(raw, recorder);
  if (!acceptable) {
    CHECK(!decoded.invocation && decoded.error && decoded.error->name == platform::kBusErrorInvalidArgs);
    return 0;
  }
  CHECK(decoded.invocation && !decoded.error);
  decoded.invocation(platform::Reply(nullptr));
  const Arguments& seen = recorder->seen;
  CHECK(seen.called && seen.token == sent.token && seen.uuid == sent.uuid && seen.requestInfo == sent.requestInfo);
  CHECK(seen.locale.has_value() == sent.locale.has_value());
  CHECK(!seen.locale || seen.locale->localeIdentifier() == sent.locale->localeIdentifier());
  return 0;
}

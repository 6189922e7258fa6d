#include "service/zlka_network_bus_interface.h"

#include <initializer_list>
#include <utility>

#include "network/request_pipeline.h"
#include "network/zlka_network_protocol.h"
#include "platform/bus/bus_values.h"
#include "platform/log/log.h"
#include "platform/values/json.h"
#include "service/answer_counts.h"
#include "support/errors.h"

using platform::BusError;
using platform::Data;
using platform::DecodedCall;
using platform::Reply;
using platform::Value;

namespace {

constexpr size_t kMaximumTokenLength = 64 * 1024;

struct TokenArguments {
  std::optional<Data> token;
  std::optional<std::string> uuid;
  std::optional<std::string> requestedLocale;
  std::optional<platform::Dictionary> requestInfo;
};

int readString(sd_bus_message* m, std::optional<std::string>& out) {
  const char* s = nullptr;
  int r = sd_bus_message_read_basic(m, 's', &s);
  if (r > 0) out = s ? s : "";
  return r;
}

std::optional<BusError> readArguments(sd_bus_message* m, bool withLocale, TokenArguments& args) {
  // Accessory tokens are tens of bytes; each 2-byte item of a token grows about 120-fold on its way
  // to the server, so a larger one is refused before any of that work.
  std::map<std::string, platform::BusKey> keys = {{"token", {"ay", kMaximumTokenLength}}, {"uuid", {"s"}}};
  if (withLocale) {
    keys.emplace("requestedLocale", platform::BusKey{"s"});
    keys.emplace("requestInfo", platform::BusKey{"a{sv}"});
  }
  return platform::readKnownDictionary(m, keys, [&](const std::string& key, sd_bus_message* message) {
    if (key == "uuid") return readString(message, args.uuid);
    if (key == "requestedLocale") return readString(message, args.requestedLocale);
    Value value;
    int r = platform::readBusValue(message, value);
    if (r < 0) return r;
    if (key == "token")
      args.token = *value.data();
    else
      args.requestInfo = *value.dictionary();
    return r;
  });
}

// A D-Bus string is UTF-8 without NUL: an answered string that is not one would reach the client
// altered (cut short at the NUL), so the call fails as a bad answer from the server instead.
std::optional<BusError> unsendable(std::initializer_list<std::pair<const char*, const std::string*>> members) {
  for (const auto& [name, value] : members) {
    if (platform::isBusString(*value)) continue;
    platform::log(
        platform::LogLevel::Error,
        "[#TokenAuth] The answer's %{public}s cannot be sent over D-Bus: it is not UTF-8 without NUL characters", name);
    return busErrorForError(request_pipeline::failure(ZLKAErrorServer));
  }
  return std::nullopt;
}

// Every answer of the three methods goes through one of these, so that the counts see them all.
void answer(const Reply& reply, Reply::Writer writer) {
  answerCounts().add("");
  reply.send(std::move(writer));
}
void refuse(const Reply& reply, BusError error) {
  answerCounts().add(error.name);
  reply.fail(std::move(error));
}
DecodedCall refused(BusError error) {
  answerCounts().add(error.name);
  return {nullptr, std::move(error)};
}

std::shared_ptr<ZLKANetworkProtocol> exported(const std::shared_ptr<void>& object) {
  return std::static_pointer_cast<ZLKANetworkProtocol>(object);
}

DecodedCall decodeMetadata(sd_bus_message* m, const std::shared_ptr<void>& object) {
  TokenArguments args;
  if (auto error = readArguments(m, true, args)) return refused(*error);
  return {[object, args](Reply reply) {
            std::optional<platform::Locale> locale;
            if (args.requestedLocale) locale = platform::Locale(*args.requestedLocale);
            exported(object)->requestMetadataForToken(
                args.token, args.uuid, locale, args.requestInfo,
                [reply](std::optional<std::string> ppid, std::optional<platform::Locale> answered,
                        std::optional<platform::Dictionary> metadata, std::optional<platform::Error> error) {
                  if (error || !ppid || !answered || !metadata)
                    return refuse(reply,
                                  error ? busErrorForError(*error) : BusError{platform::kBusErrorFailed, "No answer."});
                  std::string json = platform::json::serialize(Value(*metadata)).value_or("{}");
                  std::string locale = answered->localeIdentifier();
                  if (auto bad = unsendable({{"ppid", &*ppid}, {"locale", &locale}, {"metadata", &json}}))
                    return refuse(reply, *bad);
                  answer(reply, [ppid = *ppid, locale = std::move(locale), json = std::move(json)](sd_bus_message* r) {
                    return sd_bus_message_append(r, "sss", ppid.c_str(), locale.c_str(), json.c_str());
                  });
                });
          },
          std::nullopt};
}

DecodedCall decodeActivation(sd_bus_message* m, const std::shared_ptr<void>& object) {
  TokenArguments args;
  if (auto error = readArguments(m, false, args)) return refused(*error);
  return {[object, args](Reply reply) {
            exported(object)->requestActivationForToken(
                args.token, args.uuid, [reply](std::optional<Data> newToken, std::optional<platform::Error> error) {
                  if (error || !newToken)
                    return refuse(reply,
                                  error ? busErrorForError(*error) : BusError{platform::kBusErrorFailed, "No answer."});
                  answer(reply, [token = *newToken](sd_bus_message* r) {
                    return sd_bus_message_append_array(
                        r, 'y', token.bytes() ? token.bytes() : reinterpret_cast<const uint8_t*>(""), token.length());
                  });
                });
          },
          std::nullopt};
}

DecodedCall decodeConfirmation(sd_bus_message* m, const std::shared_ptr<void>& object) {
  TokenArguments args;
  if (auto error = readArguments(m, false, args)) return refused(*error);
  return {[object, args](Reply reply) {
            exported(object)->confirmActivationForToken(args.token, args.uuid,
                                                        [reply](std::optional<platform::Error> error) {
                                                          if (error) return refuse(reply, busErrorForError(*error));
                                                          answer(reply, nullptr);
                                                        });
          },
          std::nullopt};
}

}  // namespace

std::shared_ptr<const platform::Interface> ZLKANetworkProtocolInterface() {
  static const std::shared_ptr<const platform::Interface> interface = std::make_shared<
      const platform::Interface>(platform::Interface{
      kZLKAInterfaceName,
      {
          {"RequestMetadataForToken", "a{sv}", "sss", {"arguments"}, {"ppid", "locale", "metadata"}, decodeMetadata},
          {"RequestActivationForToken", "a{sv}", "ay", {"arguments"}, {"token"}, decodeActivation},
          {"ConfirmActivationForToken", "a{sv}", "", {"arguments"}, {}, decodeConfirmation},
      }});
  return interface;
}

BusError busErrorForError(const platform::Error& error) {
  static const char* const names[] = {"Unknown", "MissingEntitlement", "InvalidParameter", "Internal", "Network",
                                      "Server"};
  int64_t code = error.code();
  std::string name = (code <= -1 && code >= -6) ? names[-code - 1] : "Unknown";
  return BusError{kZLKAErrorPrefix + name, error.localizedDescription()};
}

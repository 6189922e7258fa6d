// zlka::Client, the installed interface: a thin translation to and from the library's own types
// around ZLKAClient, so that applications see no platform, sd-bus or JSON library types.
#include "zlka/client.h"

#include "client/zlka_client.h"
#include "platform/values/json.h"

namespace zlka {

namespace {

Error toPublic(const platform::Error& error) {
  Error out{error.domain(), error.code(), error.localizedDescription(), {}};
  if (const auto& info = error.userInfo()) {
    auto name = info->find(zlka_client::kBusErrorNameKey);
    if (name != info->end() && name->second.string()) out.busErrorName = *name->second.string();
  }
  return out;
}

std::optional<platform::Data> toData(const std::optional<Bytes>& bytes) {
  if (!bytes) return std::nullopt;
  return platform::Data(bytes->data(), bytes->size());
}

zlka_client::TokenArguments toInternal(const TokenArguments& arguments) {
  return {toData(arguments.token), arguments.uuid};
}

// The request info travels as a{sv}: its JSON text is read here so that a mistake in it is an
// InvalidRequest before anything reaches the bus.
zlka_client::Result<zlka_client::MetadataArguments> toInternal(const MetadataArguments& arguments) {
  zlka_client::MetadataArguments out{toData(arguments.token), arguments.uuid, arguments.requestedLocale, std::nullopt};
  if (!arguments.requestInfoJSON) return out;
  platform::Result<platform::Value> info = platform::json::parse(*arguments.requestInfoJSON);
  if (!info || !info->dictionary()) {
    std::string reason = info ? "an array" : "not JSON (" + info.error() + ")";
    return zlka_client::clientError(ClientErrorCode::InvalidRequest,
                                    "Cannot send the call: requestInfo is " + reason + ", not a JSON object.");
  }
  out.requestInfo = *info->dictionary();
  return out;
}

Result<Metadata> toPublic(const zlka_client::Result<zlka_client::MetadataReply>& reply) {
  if (!reply) return toPublic(reply.error());
  // The decoder accepted it as JSON, so it serialises again.
  return Metadata{reply.value().ppid, reply.value().locale,
                  platform::json::serialize(reply.value().metadata).value_or("{}")};
}

Result<Bytes> toPublic(const zlka_client::Result<platform::Data>& reply) {
  if (!reply) return toPublic(reply.error());
  return reply.value().toVector();
}

Result<Confirmation> toPublic(const zlka_client::Result<zlka_client::Confirmation>& reply) {
  if (!reply) return toPublic(reply.error());
  return Confirmation{};
}

template <class Public, class Internal>
std::function<void(zlka_client::Result<Internal>)> translated(Client::Callback<Public> callback) {
  return [callback = std::move(callback)](zlka_client::Result<Internal> reply) { callback(toPublic(reply)); };
}

}  // namespace

class Client::Impl {
 public:
  explicit Impl(std::unique_ptr<zlka_client::ZLKAClient> client) : client(std::move(client)) {}
  std::unique_ptr<zlka_client::ZLKAClient> client;
};

Client::Client(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}
Client::~Client() = default;

Result<std::unique_ptr<Client>> Client::connect(const ClientOptions& options) {
  auto client = zlka_client::ZLKAClient::connect({.bus = options.bus, .callTimeout = options.callTimeout});
  if (!client) return toPublic(client.error());
  return std::unique_ptr<Client>(new Client(std::make_unique<Impl>(std::move(client).value())));
}

Result<Metadata> Client::requestMetadata(const MetadataArguments& arguments) {
  auto internal = toInternal(arguments);
  if (!internal) return toPublic(internal.error());
  return toPublic(impl_->client->requestMetadata(internal.value()));
}

void Client::requestMetadataAsync(const MetadataArguments& arguments, Callback<Metadata> callback) {
  auto internal = toInternal(arguments);
  auto translate = translated<Metadata, zlka_client::MetadataReply>(std::move(callback));
  if (!internal) return impl_->client->failAsync(internal.error(), std::move(translate));
  impl_->client->requestMetadataAsync(internal.value(), std::move(translate));
}

Result<Bytes> Client::requestActivation(const TokenArguments& arguments) {
  return toPublic(impl_->client->requestActivation(toInternal(arguments)));
}

void Client::requestActivationAsync(const TokenArguments& arguments, Callback<Bytes> callback) {
  impl_->client->requestActivationAsync(toInternal(arguments), translated<Bytes, platform::Data>(std::move(callback)));
}

Result<Confirmation> Client::confirmActivation(const TokenArguments& arguments) {
  return toPublic(impl_->client->confirmActivation(toInternal(arguments)));
}

void Client::confirmActivationAsync(const TokenArguments& arguments, Callback<Confirmation> callback) {
  impl_->client->confirmActivationAsync(toInternal(arguments),
                                        translated<Confirmation, zlka_client::Confirmation>(std::move(callback)));
}

}  // namespace zlka

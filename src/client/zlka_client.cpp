#include "client/zlka_client.h"

#include <optional>

#include "client/bus_caller.h"
#include "client/bus_names.h"

namespace zlka_client {

namespace {

template <class T>
using Decoder = Result<T> (*)(sd_bus_message*);

template <class T>
Result<T> callAndWait(BusCaller& caller, const std::string& method, const BusCaller::ArgumentWriter& write,
                      Decoder<T> decode) {
  std::optional<Result<T>> answer;
  caller.callAndWait(method, write, [&](sd_bus_message* reply, const platform::Error* error) {
    if (error)
      answer.emplace(*error);
    else
      answer.emplace(decode(reply));
  });
  return std::move(*answer);
}

// The handler captures the callback and decoder only, never the client, which may be gone by the
// time a cancelled call is answered.
template <class T>
BusCaller::ReplyHandler handlerFor(std::function<void(Result<T>)> callback, Decoder<T> decode) {
  return [callback = std::move(callback), decode](sd_bus_message* reply, const platform::Error* error) {
    if (error)
      callback(Result<T>(*error));
    else
      callback(decode(reply));
  };
}

template <class Arguments>
BusCaller::ArgumentWriter writerFor(const Arguments& arguments) {
  return [arguments](sd_bus_message* call) { return appendArguments(call, arguments); };
}

template <class Arguments>
std::optional<platform::Error> refusal(const Arguments& arguments) {
  if (auto reason = unsendableReason(arguments))
    return clientError(ClientErrorCode::InvalidRequest, "Cannot send the call: " + *reason + ".");
  return std::nullopt;
}

template <class T, class Arguments>
Result<T> operation(BusCaller& caller, const char* method, const Arguments& arguments, Decoder<T> decode) {
  if (auto error = refusal(arguments)) return *error;
  return callAndWait(caller, method, writerFor(arguments), decode);
}

template <class T, class Arguments>
void operationAsync(BusCaller& caller, const char* method, const Arguments& arguments, Decoder<T> decode,
                    std::function<void(Result<T>)> callback) {
  BusCaller::ReplyHandler handler = handlerFor(std::move(callback), decode);
  if (auto error = refusal(arguments)) return caller.failAsync(std::move(*error), std::move(handler));
  caller.callAsync(method, writerFor(arguments), std::move(handler));
}

}  // namespace

Result<std::unique_ptr<ZLKAClient>> ZLKAClient::connect(const ClientOptions& options) {
  auto caller = BusCaller::open(options.bus, options.callTimeout);
  if (!caller) return caller.error();
  return std::unique_ptr<ZLKAClient>(new ZLKAClient(std::move(caller).value()));
}

ZLKAClient::~ZLKAClient() { caller_->close(); }

Result<MetadataReply> ZLKAClient::requestMetadata(const MetadataArguments& arguments) {
  return operation(*caller_, kMetadataMethod, arguments, &decodeMetadataReply);
}

void ZLKAClient::requestMetadataAsync(const MetadataArguments& arguments, MetadataCallback callback) {
  operationAsync(*caller_, kMetadataMethod, arguments, &decodeMetadataReply, std::move(callback));
}

Result<platform::Data> ZLKAClient::requestActivation(const TokenArguments& arguments) {
  return operation(*caller_, kActivationMethod, arguments, &decodeActivationReply);
}

void ZLKAClient::requestActivationAsync(const TokenArguments& arguments, ActivationCallback callback) {
  operationAsync(*caller_, kActivationMethod, arguments, &decodeActivationReply, std::move(callback));
}

Result<Confirmation> ZLKAClient::confirmActivation(const TokenArguments& arguments) {
  return operation(*caller_, kConfirmationMethod, arguments, &decodeConfirmationReply);
}

void ZLKAClient::confirmActivationAsync(const TokenArguments& arguments, ConfirmationCallback callback) {
  operationAsync(*caller_, kConfirmationMethod, arguments, &decodeConfirmationReply, std::move(callback));
}

Result<platform::Array> ZLKAClient::callRaw(const std::string& method, const ArgumentWriter& write) {
  return callAndWait(*caller_, method, write, &decodeAnyReply);
}

void ZLKAClient::callRawAsync(const std::string& method, ArgumentWriter write, RawCallback callback) {
  caller_->callAsync(method, std::move(write), handlerFor(std::move(callback), &decodeAnyReply));
}

void ZLKAClient::failAsync(platform::Error error, MetadataCallback callback) {
  caller_->failAsync(std::move(error), handlerFor(std::move(callback), &decodeMetadataReply));
}

}  // namespace zlka_client

#include "zlkactl/commands.h"

#include <chrono>

#include "zlkactl/output_format.h"

namespace zlkactl {

namespace {

template <class T>
int finish(const zlka::Result<T>& result, std::ostream& out, std::ostream& err, std::string (*format)(const T&, bool),
           bool json) {
  if (!result) {
    err << formatError(result.error(), json);
    return exitStatusFor(result.error());
  }
  out << format(result.value(), json);
  return kExitSuccess;
}

std::string confirmationText(const zlka::Confirmation&, bool json) { return formatConfirmation(json); }

bool isClientError(const zlka::Error& error, zlka::ClientErrorCode code) {
  return error.domain == zlka::kClientErrorDomain && error.code == static_cast<int64_t>(code);
}

}  // namespace

int exitStatusFor(const zlka::Error& error) {
  using zlka::ClientErrorCode;
  if (isClientError(error, ClientErrorCode::ConnectionFailed) ||
      isClientError(error, ClientErrorCode::ServiceUnavailable))
    return kExitUnreachable;
  if (isClientError(error, ClientErrorCode::InvalidRequest)) return kExitUsage;
  return kExitOperationFailed;
}

int fail(const Invocation& inv, std::ostream& err, int exitStatus, std::string description) {
  err << formatError(toolError(exitStatus, std::move(description)), inv.json);
  return exitStatus;
}

int runOperation(const Invocation& inv, std::ostream& out, std::ostream& err) {
  // Input is checked before the bus is touched, so that a typo never costs a round trip.
  std::optional<zlka::MetadataArguments> metadata;
  std::optional<zlka::TokenArguments> token;
  if (inv.command == Command::Metadata) {
    platform::Result<zlka::MetadataArguments> arguments = metadataArguments(inv);
    if (!arguments) return fail(inv, err, kExitUsage, arguments.error());
    metadata = *std::move(arguments);
  } else {
    platform::Result<zlka::TokenArguments> arguments = tokenArguments(inv);
    if (!arguments) return fail(inv, err, kExitUsage, arguments.error());
    token = *std::move(arguments);
  }

  const auto timeout =
      std::chrono::duration_cast<std::chrono::microseconds>(std::chrono::duration<double>(inv.timeoutSeconds));
  auto client = zlka::Client::connect({.bus = inv.bus, .callTimeout = timeout});
  if (!client) {
    err << formatError(client.error(), inv.json);
    return exitStatusFor(client.error());
  }
  zlka::Client& c = *client.value();
  switch (inv.command) {
    case Command::Metadata:
      return finish(c.requestMetadata(*metadata), out, err, &formatMetadata, inv.json);
    case Command::Activate:
      return finish(c.requestActivation(*token), out, err, &formatActivation, inv.json);
    default:
      return finish(c.confirmActivation(*token), out, err, &confirmationText, inv.json);
  }
}

int run(const Invocation& inv, std::ostream& out, std::ostream& err) {
  switch (inv.command) {
    case Command::Metadata:
    case Command::Activate:
    case Command::Confirm:
      return runOperation(inv, out, err);
    default:
      return runDefaults(inv, out, err);
  }
}

}  // namespace zlkactl

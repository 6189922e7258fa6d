#include "zlkactl/commands.h"

#include "client/zlka_client.h"
#include "zlkactl/output_format.h"

namespace zlkactl {

namespace {

template <class T>
int finish(const zlka_client::Result<T>& result, std::ostream& out, std::ostream& err, std::string (*format)(const T&, bool), bool json) {
  if (!result) {
    err << formatError(result.error());
    return exitStatusFor(result.error());
  }
  out << format(result.value(), json);
  return kExitSuccess;
}

std::string confirmationText(const zlka_client::Confirmation&, bool json) { return formatConfirmation(json); }

}  // namespace

int exitStatusFor(const platform::Error& error) {
  if (zlka_client::isServiceUnreachable(error)) return kExitUnreachable;
  if (error.domain() == zlka_client::kClientErrorDomain &&
      error.code() == static_cast<int64_t>(zlka_client::ClientErrorCode::InvalidRequest))
    return kExitUsage;
  return kExitOperationFailed;
}

int runOperation(const Invocation& inv, std::ostream& out, std::ostream& err) {
  // Input is checked before the bus is touched, so that a typo never costs a round trip.
  std::string problem;
  std::optional<zlka_client::MetadataArguments> metadata;
  std::optional<zlka_client::TokenArguments> token;
  if (inv.command == Command::Metadata) metadata = metadataArguments(inv, &problem);
  else token = tokenArguments(inv, &problem);
  if (!metadata && !token) {
    err << "zlkactl: " << problem << "\n";
    return kExitUsage;
  }

  auto client = zlka_client::ZLKAClient::connect({.bus = inv.bus});
  if (!client) {
    err << formatError(client.error());
    return exitStatusFor(client.error());
  }
  zlka_client::ZLKAClient& c = *client.value();
  switch (inv.command) {
    case Command::Metadata: return finish(c.requestMetadata(*metadata), out, err, &formatMetadata, inv.json);
    case Command::Activate: return finish(c.requestActivation(*token), out, err, &formatActivation, inv.json);
    default: return finish(c.confirmActivation(*token), out, err, &confirmationText, inv.json);
  }
}

int run(const Invocation& inv, std::ostream& out, std::ostream& err) {
  switch (inv.command) {
    case Command::Metadata:
    case Command::Activate:
    case Command::Confirm: return runOperation(inv, out, err);
    default: return runDefaults(inv, out, err);
  }
}

}  // namespace zlkactl

// zlkactl's command line: what the user asked for, parsed with CLI11.
//
//   zlkactl [--bus system|session|ADDRESS] [--json] [--timeout SECONDS] metadata|activate|confirm
//           --token-file PATH | --token-hex HEX | --token-base64 B64  --uuid UUID
//           [--locale ID] [--request-info JSON]          (the last two for metadata only)
//   zlkactl [--config PATH] defaults read [KEY] | write [--force] KEY VALUE | delete KEY
//   zlkactl --version | --help
//
// The arguments the daemon needs (a token and a uuid, and a locale for metadata) are checked here,
// so that leaving one out is a usage error rather than the daemon's InvalidParameter.
#pragma once

#include <optional>
#include <ostream>
#include <string>

#include "platform/values/result.h"
#include "zlka/client.h"

namespace zlkactl {

// Exit statuses, one per class of failure.
enum ExitStatus : int {
  kExitSuccess = 0,
  kExitOperationFailed = 1,  // the daemon (or the bus) answered with an error; settings not written
  kExitUsage = 2,            // bad arguments, unreadable or malformed input, unusable configuration
  kExitUnreachable = 3,      // the bus cannot be connected to, or the service does not answer
};

enum class Command { Metadata, Activate, Confirm, DefaultsRead, DefaultsWrite, DefaultsDelete };

inline constexpr char kDefaultConfigPath[] = "/etc/zlka/zlkad.toml";

struct Invocation {
  Command command = Command::Metadata;
  std::string bus = "system";
  bool json = false;
  double timeoutSeconds = 300;  // the library's default: an operation may wait for a session to open
  std::string configPath = kDefaultConfigPath;
  // Operations: exactly what was given on the command line.
  std::optional<std::string> tokenFile, tokenHex, tokenBase64;
  std::optional<std::string> uuid, locale, requestInfo;
  // defaults
  std::optional<std::string> key, value;
  bool force = false;  // write a key the daemon is not known to read
};

// Either an invocation to run, or the exit status after help or the version (0, printed on `out`)
// or a usage error (kExitUsage, printed on `err`, as JSON when --json was given).
struct ParsedCommandLine {
  std::optional<Invocation> invocation;
  int exitStatus = kExitSuccess;
};
ParsedCommandLine parseCommandLine(int argc, const char* const* argv, std::ostream& out, std::ostream& err);

// The call arguments of an operation invocation, reading the token from whichever source was
// given; a failure fit for the user for unusable input (a usage error).
platform::Result<zlka::MetadataArguments> metadataArguments(const Invocation& invocation);
platform::Result<zlka::TokenArguments> tokenArguments(const Invocation& invocation);

}  // namespace zlkactl

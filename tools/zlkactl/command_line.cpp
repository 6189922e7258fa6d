#include "zlkactl/command_line.h"

#include <CLI/CLI.hpp>
#include <algorithm>

#include "platform/bus/bus_values.h"
#include "zlkactl/output_format.h"
#include "zlkactl/token_input.h"

namespace zlkactl {

namespace {

struct TokenOptions {
  CLI::Option* file = nullptr;
  CLI::Option* hex = nullptr;
  CLI::Option* base64 = nullptr;
};

TokenOptions addTokenOptions(CLI::App& command, std::string& file, std::string& hex, std::string& base64) {
  TokenOptions o;
  o.file = command.add_option("--token-file", file, "Read the token bytes from the file PATH, as they are");
  o.hex = command.add_option("--token-hex", hex, "The token bytes as hex digits, e.g. 0a1b2c");
  o.base64 = command.add_option("--token-base64", base64, "The token bytes as standard base64 with padding");
  o.file->type_name("PATH")->excludes(o.hex)->excludes(o.base64);
  o.hex->type_name("HEX")->excludes(o.base64);
  o.base64->type_name("B64");
  return o;
}

std::optional<std::string> given(const CLI::Option* option, const std::string& value) {
  if (option && option->count() > 0) return value;
  return std::nullopt;
}

// CLI11's check: empty when `bus` names one, else why not.
std::string busProblem(const std::string& bus) {
  if (bus == "system" || bus == "session" || bus.find(':') != std::string::npos) return "";
  return "must be system, session or a D-Bus address such as unix:path=/run/dbus/system_bus_socket";
}

platform::Result<platform::Data> tokenData(const Invocation& inv) {
  if (inv.tokenFile) return readTokenFile(*inv.tokenFile);
  if (inv.tokenHex) return parseHexToken(*inv.tokenHex);
  if (inv.tokenBase64) return parseBase64Token(*inv.tokenBase64);
  return platform::Failure{"a token (--token-file, --token-hex or --token-base64) is required"};
}

// What the daemon refuses as InvalidParameter when it is absent, named as the user gives it;
// nullopt when nothing is missing.
std::optional<CLI::RequiredError> missingArgument(const Invocation& inv) {
  if (!inv.tokenFile && !inv.tokenHex && !inv.tokenBase64)
    return CLI::RequiredError("A token (--token-file, --token-hex or --token-base64)");
  if (!inv.uuid) return CLI::RequiredError("--uuid");
  if (inv.command == Command::Metadata && !inv.locale) return CLI::RequiredError("--locale");
  return std::nullopt;
}

bool jsonRequested(int argc, const char* const* argv) {
  return std::any_of(argv + std::min(argc, 1), argv + argc,
                     [](const char* a) { return std::string_view(a) == "--json"; });
}

// nullopt when the option is absent or UTF-8 text, else why it cannot be sent.
std::optional<std::string> textProblem(const std::optional<std::string>& text, const char* option) {
  if (!text || platform::isBusString(*text)) return std::nullopt;
  return std::string(option) + ": not UTF-8 text";
}

}  // namespace

ParsedCommandLine parseCommandLine(int argc, const char* const* argv, std::ostream& out, std::ostream& err) {
  Invocation inv;
  CLI::App app("Calls the zlkad daemon's token operations over D-Bus, and edits its developer settings.", "zlkactl");
  app.fallthrough();
  app.failure_message([](const CLI::App*, const CLI::Error& e) {
    return "zlkactl: " + std::string(e.what()) + "\nRun with --help for more information.\n";
  });
  app.require_subcommand(1);
  app.set_version_flag("--version", std::string("zlkactl ") + ZLKA_VERSION);
  app.add_option("--bus", inv.bus, "The bus to reach zlkad on: system, session, or a D-Bus address (unix:path=...)")
      ->type_name("BUS")
      ->check(CLI::Validator(busProblem, "BUS"))
      ->capture_default_str();
  app.add_flag("--json", inv.json, "Print the answer, and any error, as one line of JSON");
  app.add_option("--timeout", inv.timeoutSeconds,
                 "Give up on the call after SECONDS (opening a session can take minutes)")
      ->type_name("SECONDS")
      ->check(CLI::Range(0.001, 86400.0))
      ->capture_default_str();
  app.add_option("--config", inv.configPath,
                 "The configuration file whose [settings] suite_dir holds the settings (defaults only)")
      ->type_name("PATH")
      ->capture_default_str();
  app.footer(
      "Exit status: 0 success, 1 the operation failed, 2 usage error, 3 the service cannot be reached.\n"
      "Errors go to standard error, with --json as {\"code\":C,\"description\":D,\"domain\":N}; zlkactl's own\n"
      "errors (usage, input, settings) have the domain \"zlkactl\" and the exit status as their code.\n"
      "Examples:\n"
      "  zlkactl metadata --token-hex 0a1b2c --uuid 6f1c9a52-0000-4000-8000-000000000001 --locale en_US\n"
      "  zlkactl --bus session --json activate --token-file token.bin --uuid 6f1c9a52-0000-4000-8000-000000000001\n"
      "  zlkactl defaults write ForceNetworkFailure true");

  std::string file, hex, base64, uuid, locale, requestInfo;

  CLI::App* metadata =
      app.add_subcommand("metadata", "Ask for the product-plan metadata of a token (RequestMetadataForToken)");
  TokenOptions metadataToken = addTokenOptions(*metadata, file, hex, base64);
  CLI::Option* metadataUUID = metadata->add_option("--uuid", uuid, "The accessory's UUID")->type_name("UUID");
  CLI::Option* metadataLocale =
      metadata->add_option("--locale", locale, "The locale to answer in, as an identifier such as en_US")
          ->type_name("ID");
  CLI::Option* metadataInfo =
      metadata
          ->add_option("--request-info", requestInfo, "Request info as a JSON object, e.g. '{\"source\":\"setup\"}'")
          ->type_name("JSON");
  metadata->footer(
      "Prints the ppid, the locale and the metadata; with --json {\"locale\":...,\"metadata\":{...},\"ppid\":...}.\n"
      "Example:\n"
      "  zlkactl metadata --token-base64 CgsM --uuid 6f1c9a52-0000-4000-8000-000000000001 --locale en_US \\\n"
      "      --request-info '{\"source\":\"setup\"}'");

  CLI::App* activate = app.add_subcommand("activate", "Activate a token for an accessory (RequestActivationForToken)");
  TokenOptions activateToken = addTokenOptions(*activate, file, hex, base64);
  CLI::Option* activateUUID = activate->add_option("--uuid", uuid, "The accessory's UUID")->type_name("UUID");
  activate->footer(
      "Prints the new token in hex and its length; with --json {\"length\":N,\"token_base64\":...,\"token_hex\":...}.\n"
      "Example:\n"
      "  zlkactl activate --token-file token.bin --uuid 6f1c9a52-0000-4000-8000-000000000001");

  CLI::App* confirm =
      app.add_subcommand("confirm", "Confirm that an accessory took its new token (ConfirmActivationForToken)");
  TokenOptions confirmToken = addTokenOptions(*confirm, file, hex, base64);
  CLI::Option* confirmUUID = confirm->add_option("--uuid", uuid, "The accessory's UUID")->type_name("UUID");
  confirm->footer(
      "Prints \"confirmed\"; with --json {\"confirmed\":true}.\n"
      "Example:\n"
      "  zlkactl confirm --token-file new-token.bin --uuid 6f1c9a52-0000-4000-8000-000000000001");

  CLI::App* defaults =
      app.add_subcommand("defaults", "Read and edit the developer settings suite com.kestro.ZLKAuthentication");
  defaults->require_subcommand(1);
  defaults->footer(
      "The suite is <suite_dir>/com.kestro.ZLKAuthentication.json, suite_dir from [settings] of the configuration "
      "file.\n"
      "Examples:\n"
      "  zlkactl defaults read\n"
      "  zlkactl --config ./zlkad.toml defaults write CustomServer https://127.0.0.1:8443\n"
      "  zlkactl defaults delete CustomServer");
  std::string key, value;
  CLI::App* read = defaults->add_subcommand("read", "Print one setting, or the whole suite, as JSON");
  read->add_option("KEY", key, "The setting to print; all of them when left out");
  read->footer("Example:\n  zlkactl defaults read ForceNetworkFailure");
  CLI::App* write = defaults->add_subcommand("write", "Set a setting (only one zlkad reads, unless --force)");
  write->add_flag("--force", inv.force, "Write a key that zlkad is not known to read");
  write->add_option("KEY", key, "The setting")->required();
  write
      ->add_option("VALUE", value,
                   "Its value: JSON when it is one JSON value (true, 3, \"x\", {...}), else a plain string")
      ->required();
  write->footer("Examples:\n  zlkactl defaults write ForceNetworkFailure true\n  zlkactl defaults write Server it");
  CLI::App* remove = defaults->add_subcommand("delete", "Remove a setting");
  remove->add_option("KEY", key, "The setting")->required();
  remove->footer("Example:\n  zlkactl defaults delete ForceNetworkFailure");

  auto takeOperation = [&](Command command, const TokenOptions& t, CLI::Option* uuidOption) {
    inv.command = command;
    inv.tokenFile = given(t.file, file);
    inv.tokenHex = given(t.hex, hex);
    inv.tokenBase64 = given(t.base64, base64);
    inv.uuid = given(uuidOption, uuid);
  };
  // CLI11 reports what it refuses by throwing; a missing argument is reported the same way.
  auto refuse = [&](const CLI::ParseError& e) -> ParsedCommandLine {
    if (e.get_exit_code() == 0 || !jsonRequested(argc, argv)) {
      int status = app.exit(e, out, err);
      return {std::nullopt, status == 0 ? kExitSuccess : kExitUsage};
    }
    err << formatError(toolError(kExitUsage, e.what()), true);
    return {std::nullopt, kExitUsage};
  };
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    return refuse(e);
  }
  if (*metadata) {
    takeOperation(Command::Metadata, metadataToken, metadataUUID);
    inv.locale = given(metadataLocale, locale);
    inv.requestInfo = given(metadataInfo, requestInfo);
  } else if (*activate) {
    takeOperation(Command::Activate, activateToken, activateUUID);
  } else if (*confirm) {
    takeOperation(Command::Confirm, confirmToken, confirmUUID);
  }
  if (*metadata || *activate || *confirm) {
    if (std::optional<CLI::RequiredError> missing = missingArgument(inv)) return refuse(*missing);
  }

  if (*read) {
    inv.command = Command::DefaultsRead;
    if (read->count("KEY") > 0) inv.key = key;
  } else if (*write) {
    inv.command = Command::DefaultsWrite;
    inv.key = key;
    inv.value = value;
  } else if (*remove) {
    inv.command = Command::DefaultsDelete;
    inv.key = key;
  }
  return {std::move(inv), kExitSuccess};
}

platform::Result<zlka::TokenArguments> tokenArguments(const Invocation& inv) {
  platform::Result<platform::Data> data = tokenData(inv);
  if (!data) return platform::Failure{data.error()};
  if (auto problem = textProblem(inv.uuid, "--uuid")) return platform::Failure{*problem};
  return zlka::TokenArguments{data->toVector(), inv.uuid};
}

platform::Result<zlka::MetadataArguments> metadataArguments(const Invocation& inv) {
  platform::Result<platform::Data> data = tokenData(inv);
  if (!data) return platform::Failure{data.error()};
  for (auto [text, option] : {std::pair{&inv.uuid, "--uuid"}, std::pair{&inv.locale, "--locale"}})
    if (auto problem = textProblem(*text, option)) return platform::Failure{*problem};
  // Checked here too, for a message that names the option; the library sends the text as it is.
  if (inv.requestInfo) {
    platform::Result<platform::Dictionary> requestInfo = parseRequestInfo(*inv.requestInfo);
    if (!requestInfo) return platform::Failure{requestInfo.error()};
  }
  return zlka::MetadataArguments{data->toVector(), inv.uuid, inv.locale, inv.requestInfo};
}

}  // namespace zlkactl

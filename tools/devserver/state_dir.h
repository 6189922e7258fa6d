// The server's state directory. prepareStateDirectory() creates the directory (0700) if it is
// absent and fills in what is missing:
//   ca.pem, ca.key                TLS CA
//   server.pem, server.key        TLS server certificate for 127.0.0.1, ::1 and localhost
//   sap-root.pem, sap-root.key    SAP root (the daemon's trust anchor)
//   setup.crt (DER), setup.pem, setup.key   setup certificate issued by the SAP root
// plus the directories defaults/ and entitlements.d/. Existing files are reused after checking
// that they parse, belong together and have not expired; a certificate whose issuer had to be
// made anew is made anew too. Private keys are written 0600, every file atomically.
// writeDaemonConfiguration() writes zlkad.toml, pointing every server environment at `baseURL`.
// Both fail naming the file and what is wrong with it.
#pragma once

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/values/result.h"
#include "tarvexsap/tarvex_sap_certs.h"

namespace devserver {

struct DevServerState {
  std::filesystem::path dir;  // absolute
  TarvexSAPCredential tls;    // server certificate and its key
  std::vector<uint8_t> setupCertificateDER;
  TarvexSAPKey setupKey;
};

// prepareStateDirectory returns the state in `dir`, made or completed as above, or a failure.
platform::Result<DevServerState> prepareStateDirectory(const std::filesystem::path& dir);

// The text of zlkad.toml for a server at `baseURL` keeping its state in `dir` (absolute).
std::string daemonConfiguration(const std::filesystem::path& dir, std::string_view baseURL);
// writeDaemonConfiguration writes that text to `dir`/zlkad.toml; nullopt on success, else why not.
platform::Done writeDaemonConfiguration(const std::filesystem::path& dir, std::string_view baseURL);

}  // namespace devserver

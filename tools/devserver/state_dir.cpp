#include "devserver/state_dir.h"

#include <openssl/err.h>
#include <openssl/x509.h>
#include <sys/stat.h>

#include <cstdio>
#include <optional>
#include <sstream>

#include "devserver/state_files.h"
#include "devserver/tls_credentials.h"

namespace devserver {

namespace fs = std::filesystem;

namespace {

constexpr mode_t kPrivateMode = 0600;
constexpr mode_t kPublicMode = 0644;

using platform::Done;
using platform::Failure;
using platform::Result;

// What the certificate tooling parsed out of `path`, or a failure naming the file.
template <typename T>
Result<T> parsed(const fs::path& path, platform::Result<T> read) {
  if (!read) {
    return fileError(path, "does not parse");
  }
  return *std::move(read);
}

// Writes what the certificate tooling encoded (PEM text or DER bytes), or passes its failure on.
template <typename Bytes>
Done writeEncoded(const fs::path& path, const platform::Result<Bytes>& encoded, mode_t mode) {
  if (!encoded) {
    return Failure{encoded.error()};
  }
  return writeStateFile(path, std::string_view(reinterpret_cast<const char*>(encoded->data()), encoded->size()), mode);
}

// `cert` read from `certPath` with the key in `keyText`, once they are known to belong together
// and the certificate to be still valid.
Result<TarvexSAPCredential> withCheckedKey(TarvexSAPCert cert, const fs::path& certPath, const std::string& keyText,
                                           const fs::path& keyPath) {
  Result<TarvexSAPKey> key = parsed(keyPath, TarvexSAPKeyFromPEM(keyText));
  if (!key) {
    return Failure{key.error()};
  }
  const bool fits = X509_check_private_key(cert.get(), key->get()) == 1;
  ERR_clear_error();
  if (!fits) {
    return fileError(keyPath, "is not the key of " + certPath.string());
  }
  if (X509_cmp_current_time(X509_get0_notAfter(cert.get())) <= 0) {
    return fileError(certPath, "the certificate has expired; remove it with its key to make a new one");
  }
  return TarvexSAPCredential{std::move(cert), *std::move(key)};
}

// A PEM certificate with its PEM key, or nullopt when neither file exists.
Result<std::optional<TarvexSAPCredential>> loadCredential(const fs::path& dir, const char* certName,
                                                          const char* keyName) {
  const fs::path certPath = dir / certName;
  const fs::path keyPath = dir / keyName;
  const Result<std::optional<std::string>> certText = readFile(certPath);
  if (!certText) {
    return Failure{certText.error()};
  }
  const Result<std::optional<std::string>> keyText = readFile(keyPath);
  if (!keyText) {
    return Failure{keyText.error()};
  }
  if (!*certText && !*keyText) {
    return std::optional<TarvexSAPCredential>();
  }
  if (!*certText || !*keyText) {
    const fs::path& missing = *certText ? keyPath : certPath;
    const fs::path& present = *certText ? certPath : keyPath;
    return fileError(missing,
                     "is missing while " + present.string() + " exists; restore it, or remove both to make new ones");
  }
  Result<TarvexSAPCert> cert = parsed(certPath, TarvexSAPCertFromPEM(**certText));
  if (!cert) {
    return Failure{cert.error()};
  }
  Result<TarvexSAPCredential> credential = withCheckedKey(*std::move(cert), certPath, **keyText, keyPath);
  if (!credential) {
    return Failure{credential.error()};
  }
  return std::optional<TarvexSAPCredential>(*std::move(credential));
}

// A credential just made, once stored as PEM under these names.
Result<TarvexSAPCredential> stored(Result<TarvexSAPCredential> made, const fs::path& dir, const char* certName,
                                   const char* keyName) {
  if (!made) {
    return made;
  }
  if (Done failed = writeEncoded(dir / keyName, TarvexSAPKeyToPEM(made->key.get()), kPrivateMode)) {
    return *failed;
  }
  if (Done failed = writeEncoded(dir / certName, TarvexSAPCertToPEM(made->certificate.get()), kPublicMode)) {
    return *failed;
  }
  return made;
}

Result<fs::path> makeDirectory(const fs::path& requested) {
  if (requested.empty()) {
    return Failure{"no state directory given"};
  }
  std::error_code error;
  const fs::path dir = fs::absolute(requested, error).lexically_normal();
  if (error) {
    return fileError(requested, error.message());
  }
  if (!fs::exists(dir, error)) {
    fs::create_directories(dir, error);
    if (!error) {
      fs::permissions(dir, fs::perms::owner_all, fs::perm_options::replace, error);
    }
    if (error) {
      return fileError(dir, "cannot create the state directory: " + error.message());
    }
  } else if (!fs::is_directory(dir, error)) {
    return fileError(dir, "is not a directory");
  }
  for (const char* sub : {"defaults", "entitlements.d"}) {
    fs::create_directory(dir / sub, error);
    if (error) {
      return fileError(dir / sub, "cannot create the directory: " + error.message());
    }
  }
  return dir;
}

Result<TarvexSAPCredential> prepareTLS(const fs::path& dir) {
  Result<std::optional<TarvexSAPCredential>> kept = loadCredential(dir, "ca.pem", "ca.key");
  if (!kept) {
    return Failure{kept.error()};
  }
  // A server certificate of a CA that is gone can never verify again: it is replaced.
  if (!*kept) {
    const Result<TarvexSAPCredential> authority =
        stored(makeTLSAuthority("zlka-devserver local CA"), dir, "ca.pem", "ca.key");
    if (!authority) {
      return Failure{authority.error()};
    }
    return stored(issueTLSServerCertificate(*authority, "localhost"), dir, "server.pem", "server.key");
  }
  const TarvexSAPCredential& authority = **kept;
  Result<std::optional<TarvexSAPCredential>> server = loadCredential(dir, "server.pem", "server.key");
  if (!server) {
    return Failure{server.error()};
  }
  if (!*server) {
    return stored(issueTLSServerCertificate(authority, "localhost"), dir, "server.pem", "server.key");
  }
  if (!issuedBy((*server)->certificate.get(), authority)) {
    return fileError(dir / "server.pem", "was not issued by " + (dir / "ca.pem").string() +
                                             "; remove server.pem and server.key to make new ones");
  }
  return **std::move(server);
}

// Writes the PEM and the DER form of the setup certificate where asked to.
Done writeSetupCertificate(const fs::path& pemPath, const fs::path& derPath, X509* cert, bool pem, bool der) {
  Done failed;
  if (pem) {
    failed = writeEncoded(pemPath, TarvexSAPCertToPEM(cert), kPublicMode);
  }
  if (der && !failed) {
    failed = writeEncoded(derPath, TarvexSAPCertToDER(cert), kPublicMode);
  }
  return failed;
}

// The setup certificate's files and what they hold (nullopt: absent).
struct SetupFiles {
  fs::path derPath, pemPath, keyPath;
  std::optional<std::string> der, pem, key;
};

// The files of a root that had to be made anew are not read (`read` false): they are made anew too.
Result<SetupFiles> readSetupFiles(const fs::path& dir, bool read) {
  SetupFiles files{dir / "setup.crt", dir / "setup.pem", dir / "setup.key", {}, {}, {}};
  for (auto [path, text] :
       {std::pair{&files.derPath, &files.der}, {&files.pemPath, &files.pem}, {&files.keyPath, &files.key}}) {
    Result<std::optional<std::string>> content = read ? readFile(*path) : std::optional<std::string>();
    if (!content) {
      return Failure{content.error()};
    }
    *text = *std::move(content);
  }
  return files;
}

Result<TarvexSAPCredential> makeSetupCertificate(const SetupFiles& files, const TarvexSAPCredential& root) {
  Result<TarvexSAPCredential> setup = TarvexSAPIssueSetupCertificate(root, "zlka-devserver setup certificate");
  if (!setup) {
    return setup;
  }
  if (Done failed = writeEncoded(files.keyPath, TarvexSAPKeyToPEM(setup->key.get()), kPrivateMode)) {
    return *failed;
  }
  if (Done failed = writeSetupCertificate(files.pemPath, files.derPath, setup->certificate.get(), true, true)) {
    return *failed;
  }
  return setup;
}

// The certificate in whichever of its two forms exist; where both do, they must agree.
Result<TarvexSAPCert> existingSetupCertificate(const SetupFiles& files) {
  TarvexSAPCert certificate;
  if (files.der) {
    const auto* bytes = reinterpret_cast<const uint8_t*>(files.der->data());
    Result<TarvexSAPCert> fromDER = parsed(files.derPath, TarvexSAPCertFromDER(std::span(bytes, files.der->size())));
    if (!fromDER) {
      return fromDER;
    }
    certificate = *std::move(fromDER);
  }
  if (files.pem) {
    Result<TarvexSAPCert> fromPEM = parsed(files.pemPath, TarvexSAPCertFromPEM(*files.pem));
    if (!fromPEM) {
      return fromPEM;
    }
    if (certificate && X509_cmp(certificate.get(), fromPEM->get()) != 0) {
      return fileError(files.pemPath,
                       "holds another certificate than " + files.derPath.string() + "; remove the one that is wrong");
    }
    certificate = *std::move(fromPEM);
  }
  return certificate;
}

// The setup certificate lives in two forms; either one restores the other.
Result<TarvexSAPCredential> prepareSetupCertificate(const fs::path& dir, const TarvexSAPCredential& root,
                                                    bool newRoot) {
  const Result<SetupFiles> files = readSetupFiles(dir, !newRoot);
  if (!files) {
    return Failure{files.error()};
  }
  if (!files->der && !files->pem && !files->key) {
    return makeSetupCertificate(*files, root);
  }
  if (!files->key) {
    return fileError(files->keyPath,
                     "is missing while the setup certificate exists; restore it, or remove "
                     "setup.crt, setup.pem and setup.key to make new ones");
  }
  if (!files->der && !files->pem) {
    return fileError(files->derPath,
                     "is missing (and so is setup.pem) while setup.key exists; restore it, or "
                     "remove setup.key to make new ones");
  }
  Result<TarvexSAPCert> certificate = existingSetupCertificate(*files);
  if (!certificate) {
    return Failure{certificate.error()};
  }
  const fs::path& certPath = files->der ? files->derPath : files->pemPath;
  Result<TarvexSAPCredential> setup = withCheckedKey(*std::move(certificate), certPath, *files->key, files->keyPath);
  if (!setup) {
    return setup;
  }
  if (!issuedBy(setup->certificate.get(), root)) {
    return fileError(certPath, "was not issued by " + (dir / "sap-root.pem").string() +
                                   "; remove setup.crt, setup.pem and setup.key to make new ones");
  }
  if (Done failed =
          writeSetupCertificate(files->pemPath, files->derPath, setup->certificate.get(), !files->pem, !files->der)) {
    return *failed;
  }
  return setup;
}

std::string tomlString(std::string_view text) {
  std::string out = "\"";
  for (const char c : text) {
    const auto u = static_cast<unsigned char>(c);
    if (c == '"' || c == '\\') {
      out += '\\';
      out += c;
    } else if (u < 0x20 || u == 0x7f) {
      char escaped[8];
      std::snprintf(escaped, sizeof escaped, "\\u%04X", u);
      out += escaped;
    } else {
      out += c;
    }
  }
  return out + "\"";
}

}  // namespace

Result<DevServerState> prepareStateDirectory(const fs::path& requested) {
  DevServerState state;
  const Result<fs::path> dir = makeDirectory(requested);
  if (!dir) {
    return Failure{dir.error()};
  }
  state.dir = *dir;
  Result<TarvexSAPCredential> tls = prepareTLS(state.dir);
  if (!tls) {
    return Failure{tls.error()};
  }
  state.tls = *std::move(tls);
  Result<std::optional<TarvexSAPCredential>> kept = loadCredential(state.dir, "sap-root.pem", "sap-root.key");
  if (!kept) {
    return Failure{kept.error()};
  }
  const bool newRoot = !*kept;
  const Result<TarvexSAPCredential> root =
      newRoot ? stored(TarvexSAPMakeRoot("zlka-devserver SAP root"), state.dir, "sap-root.pem", "sap-root.key")
              : Result<TarvexSAPCredential>(**std::move(kept));
  if (!root) {
    return Failure{root.error()};
  }
  Result<TarvexSAPCredential> setup = prepareSetupCertificate(state.dir, *root, newRoot);
  if (!setup) {
    return Failure{setup.error()};
  }
  TarvexSAPCredential credential = *std::move(setup);
  Result<std::vector<uint8_t>> der = TarvexSAPCertToDER(credential.certificate.get());
  if (!der) {
    return Failure{der.error()};
  }
  state.setupCertificateDER = *std::move(der);
  state.setupKey = std::move(credential.key);
  return state;
}

std::string daemonConfiguration(const fs::path& dir, std::string_view baseURL) {
  const std::string url = tomlString(baseURL);
  std::ostringstream text;
  text << "# Written by zlka-devserver at every start: it carries the server's current port.\n"
       << "[device]\n"
       << "internal_build = false\n"
       << "device_class = \"AccessoryHub\"\n";
  for (const char* environment : {"prod", "it", "ut", "maint"}) {
    text << "\n[servers." << environment << "]\n"
         << "static_content = " << url << "\n"
         << "api = " << url << "\n";
  }
  text << "\n[tls]\n"
       << "ca_file = " << tomlString((dir / "ca.pem").string()) << "\n"
       << "\n[sap]\n"
       << "trust_anchor = " << tomlString((dir / "sap-root.pem").string()) << "\n"
       << "\n[settings]\n"
       << "suite_dir = " << tomlString((dir / "defaults").string()) << "\n"
       << "\n[entitlements]\n"
       << "dir = " << tomlString((dir / "entitlements.d").string()) << "\n"
       << "\n[log]\n"
       << "level = \"default\"\n"
       << "private_data = false\n";
  return std::move(text).str();
}

Done writeDaemonConfiguration(const fs::path& dir, std::string_view baseURL) {
  return writeStateFile(dir / "zlkad.toml", daemonConfiguration(dir, baseURL), kPublicMode);
}

}  // namespace devserver

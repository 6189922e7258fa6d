#include "devserver/state_dir.h"

#include <fcntl.h>
#include <openssl/err.h>
#include <openssl/x509.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <optional>
#include <sstream>
#include <stdexcept>
#include <system_error>

#include "devserver/tls_credentials.h"

namespace devserver {

namespace fs = std::filesystem;

namespace {

constexpr mode_t kPrivateMode = 0600;
constexpr mode_t kPublicMode = 0644;

std::runtime_error fileError(const fs::path& path, const std::string& what) {
  return std::runtime_error(path.string() + ": " + what);
}

std::optional<std::string> readFile(const fs::path& path) {
  std::error_code error;
  if (!fs::exists(path, error)) {
    if (error) {
      throw fileError(path, error.message());
    }
    return std::nullopt;
  }
  std::ifstream in(path, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  if (!in) {
    throw fileError(path, "cannot be read");
  }
  return std::move(text).str();
}

// Written under a temporary name and renamed, so a reader never sees half a key.
void writeFileAtomically(const fs::path& path, std::string_view content, mode_t mode) {
  std::string temporary = path.string() + ".XXXXXX";
  const int fd = mkstemp(temporary.data());
  if (fd < 0) {
    throw fileError(path, std::string("cannot be created: ") + std::strerror(errno));
  }
  int error = fchmod(fd, mode) == 0 ? 0 : errno;
  for (std::size_t done = 0; error == 0 && done < content.size();) {
    const ssize_t n = ::write(fd, content.data() + done, content.size() - done);
    if (n > 0) {
      done += static_cast<std::size_t>(n);
    } else if (n == 0 || errno != EINTR) {
      error = n == 0 ? EIO : errno;
    }
  }
  if (error == 0 && fsync(fd) != 0) {
    error = errno;
  }
  if (::close(fd) != 0 && error == 0) {
    error = errno;
  }
  if (error == 0 && std::rename(temporary.c_str(), path.c_str()) != 0) {
    error = errno;
  }
  if (error != 0) {
    std::remove(temporary.c_str());
    throw fileError(path, std::string("cannot be written: ") + std::strerror(error));
  }
}

std::string bytesAsString(const std::vector<uint8_t>& bytes) { return std::string(bytes.begin(), bytes.end()); }

void requireUnexpired(X509* cert, const fs::path& path) {
  if (X509_cmp_current_time(X509_get0_notAfter(cert)) <= 0) {
    throw fileError(path, "the certificate has expired; remove it with its key to make a new one");
  }
}

void requireKeyFits(X509* cert, EVP_PKEY* key, const fs::path& certPath, const fs::path& keyPath) {
  const bool fits = X509_check_private_key(cert, key) == 1;
  ERR_clear_error();
  if (!fits) {
    throw fileError(keyPath, "is not the key of " + certPath.string());
  }
}

template <typename Parse>
auto parseFile(const fs::path& path, const std::string& text, Parse parse) {
  try {
    return parse(text);
  } catch (const std::exception&) {
    throw fileError(path, "does not parse");
  }
}

// A PEM certificate with its PEM key, or nullopt when neither file exists.
std::optional<TarvexSAPCredential> loadCredential(const fs::path& dir, const char* certName, const char* keyName) {
  const fs::path certPath = dir / certName;
  const fs::path keyPath = dir / keyName;
  const auto certText = readFile(certPath);
  const auto keyText = readFile(keyPath);
  if (!certText && !keyText) {
    return std::nullopt;
  }
  if (!certText || !keyText) {
    const fs::path& missing = certText ? keyPath : certPath;
    const fs::path& present = certText ? certPath : keyPath;
    throw fileError(missing,
                    "is missing while " + present.string() + " exists; restore it, or remove both to make new ones");
  }
  TarvexSAPCredential credential;
  credential.certificate = parseFile(certPath, *certText, [](const std::string& t) { return TarvexSAPCertFromPEM(t); });
  credential.key = parseFile(keyPath, *keyText, [](const std::string& t) { return TarvexSAPKeyFromPEM(t); });
  requireKeyFits(credential.certificate.get(), credential.key.get(), certPath, keyPath);
  requireUnexpired(credential.certificate.get(), certPath);
  return credential;
}

void storeCredential(const fs::path& dir, const char* certName, const char* keyName,
                     const TarvexSAPCredential& credential) {
  writeFileAtomically(dir / keyName, TarvexSAPKeyToPEM(credential.key.get()), kPrivateMode);
  writeFileAtomically(dir / certName, TarvexSAPCertToPEM(credential.certificate.get()), kPublicMode);
}

fs::path makeDirectory(const fs::path& requested) {
  if (requested.empty()) {
    throw std::runtime_error("no state directory given");
  }
  std::error_code error;
  const fs::path dir = fs::absolute(requested, error).lexically_normal();
  if (error) {
    throw fileError(requested, error.message());
  }
  if (!fs::exists(dir, error)) {
    fs::create_directories(dir, error);
    if (!error) {
      fs::permissions(dir, fs::perms::owner_all, fs::perm_options::replace, error);
    }
    if (error) {
      throw fileError(dir, "cannot create the state directory: " + error.message());
    }
  } else if (!fs::is_directory(dir, error)) {
    throw fileError(dir, "is not a directory");
  }
  for (const char* sub : {"defaults", "entitlements.d"}) {
    fs::create_directory(dir / sub, error);
    if (error) {
      throw fileError(dir / sub, "cannot create the directory: " + error.message());
    }
  }
  return dir;
}

TarvexSAPCredential prepareTLS(const fs::path& dir) {
  std::optional<TarvexSAPCredential> authority = loadCredential(dir, "ca.pem", "ca.key");
  const bool newAuthority = !authority;
  if (newAuthority) {
    authority = makeTLSAuthority("zlka-devserver local CA");
    storeCredential(dir, "ca.pem", "ca.key", *authority);
  }
  // A server certificate of a CA that is gone can never verify again: it is replaced.
  std::optional<TarvexSAPCredential> server;
  if (!newAuthority) {
    server = loadCredential(dir, "server.pem", "server.key");
    if (server && !issuedBy(server->certificate.get(), *authority)) {
      throw fileError(dir / "server.pem", "was not issued by " + (dir / "ca.pem").string() +
                                              "; remove server.pem and server.key to make new ones");
    }
  }
  if (!server) {
    server = issueTLSServerCertificate(*authority, "localhost");
    storeCredential(dir, "server.pem", "server.key", *server);
  }
  return std::move(*server);
}

// The setup certificate lives in two forms; either one restores the other.
TarvexSAPCredential prepareSetupCertificate(const fs::path& dir, const TarvexSAPCredential& root, bool newRoot) {
  const fs::path derPath = dir / "setup.crt";
  const fs::path pemPath = dir / "setup.pem";
  const fs::path keyPath = dir / "setup.key";
  std::optional<std::string> der, pem, key;
  if (!newRoot) {
    der = readFile(derPath);
    pem = readFile(pemPath);
    key = readFile(keyPath);
  }
  if (!der && !pem && !key) {
    TarvexSAPCredential setup = TarvexSAPIssueSetupCertificate(root, "zlka-devserver setup certificate");
    writeFileAtomically(keyPath, TarvexSAPKeyToPEM(setup.key.get()), kPrivateMode);
    writeFileAtomically(pemPath, TarvexSAPCertToPEM(setup.certificate.get()), kPublicMode);
    writeFileAtomically(derPath, bytesAsString(TarvexSAPCertToDER(setup.certificate.get())), kPublicMode);
    return setup;
  }
  if (!key) {
    throw fileError(keyPath,
                    "is missing while the setup certificate exists; restore it, or remove "
                    "setup.crt, setup.pem and setup.key to make new ones");
  }
  if (!der && !pem) {
    throw fileError(derPath,
                    "is missing (and so is setup.pem) while setup.key exists; restore it, or "
                    "remove setup.key to make new ones");
  }
  TarvexSAPCredential setup;
  if (der) {
    setup.certificate = parseFile(derPath, *der, [](const std::string& t) {
      return TarvexSAPCertFromDER(std::span(reinterpret_cast<const uint8_t*>(t.data()), t.size()));
    });
  }
  if (pem) {
    TarvexSAPCert fromPEM = parseFile(pemPath, *pem, [](const std::string& t) { return TarvexSAPCertFromPEM(t); });
    if (setup.certificate && X509_cmp(setup.certificate.get(), fromPEM.get()) != 0) {
      throw fileError(pemPath, "holds another certificate than " + derPath.string() + "; remove the one that is wrong");
    }
    setup.certificate = std::move(fromPEM);
  }
  setup.key = parseFile(keyPath, *key, [](const std::string& t) { return TarvexSAPKeyFromPEM(t); });
  const fs::path& certPath = der ? derPath : pemPath;
  requireKeyFits(setup.certificate.get(), setup.key.get(), certPath, keyPath);
  requireUnexpired(setup.certificate.get(), certPath);
  if (!issuedBy(setup.certificate.get(), root)) {
    throw fileError(certPath, "was not issued by " + (dir / "sap-root.pem").string() +
                                  "; remove setup.crt, setup.pem and setup.key to make new ones");
  }
  if (!der) {
    writeFileAtomically(derPath, bytesAsString(TarvexSAPCertToDER(setup.certificate.get())), kPublicMode);
  }
  if (!pem) {
    writeFileAtomically(pemPath, TarvexSAPCertToPEM(setup.certificate.get()), kPublicMode);
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

DevServerState prepareStateDirectory(const fs::path& requested) {
  DevServerState state;
  state.dir = makeDirectory(requested);
  state.tls = prepareTLS(state.dir);
  std::optional<TarvexSAPCredential> root = loadCredential(state.dir, "sap-root.pem", "sap-root.key");
  const bool newRoot = !root;
  if (newRoot) {
    root = TarvexSAPMakeRoot("zlka-devserver SAP root");
    storeCredential(state.dir, "sap-root.pem", "sap-root.key", *root);
  }
  TarvexSAPCredential setup = prepareSetupCertificate(state.dir, *root, newRoot);
  state.setupCertificateDER = TarvexSAPCertToDER(setup.certificate.get());
  state.setupKey = std::move(setup.key);
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

void writeDaemonConfiguration(const fs::path& dir, std::string_view baseURL) {
  writeFileAtomically(dir / "zlkad.toml", daemonConfiguration(dir, baseURL), kPublicMode);
}

}  // namespace devserver

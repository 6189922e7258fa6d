// The server's own TLS chain: a private CA (ECDSA P-256, CA:TRUE, keyCertSign) and a server
// certificate it issues (serverAuth, subjectAltName IP:127.0.0.1, IP:::1, DNS:localhost), each
// with subject and authority key identifiers, valid from an hour ago for ten years.
// issuedBy() says whether `cert` carries a valid signature of the CA's key and names it as
// issuer. Failures of the crypto library throw std::runtime_error.
#pragma once

#include <string_view>

#include "tarvexsap/tarvex_sap_certs.h"

namespace devserver {

TarvexSAPCredential makeTLSAuthority(std::string_view commonName);
TarvexSAPCredential issueTLSServerCertificate(const TarvexSAPCredential& authority, std::string_view commonName);
bool issuedBy(X509* cert, const TarvexSAPCredential& authority);

}  // namespace devserver

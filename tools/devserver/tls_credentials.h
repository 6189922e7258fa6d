// The server's own TLS chain: a private CA (ECDSA P-256, CA:TRUE, keyCertSign) and a server
// certificate it issues (serverAuth, subjectAltName IP:127.0.0.1, IP:::1, DNS:localhost), each
// with subject and authority key identifiers, valid from an hour ago for ten years. Making one
// fails, with a text starting "TLS certificate: ", only when the crypto library does.
#pragma once

#include <string_view>

#include "platform/values/result.h"
#include "tarvexsap/tarvex_sap_certs.h"

namespace devserver {

// makeTLSAuthority returns a new self-signed CA named `commonName` with its key, or a failure.
platform::Result<TarvexSAPCredential> makeTLSAuthority(std::string_view commonName);
// issueTLSServerCertificate returns a new server certificate named `commonName`, issued by
// `authority` (which must hold its key), with its own key, or a failure.
platform::Result<TarvexSAPCredential> issueTLSServerCertificate(const TarvexSAPCredential& authority,
                                                                std::string_view commonName);
// issuedBy says whether `cert` carries a valid signature of the authority's key and names it as issuer.
bool issuedBy(X509* cert, const TarvexSAPCredential& authority);

}  // namespace devserver

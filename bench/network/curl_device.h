// The floor the service is measured against: the device side of one association made by hand,
// sending the same signed HTTPS POSTs with libcurl over one reused connection and verifying the
// signed answers, with nothing else in between.
#pragma once

#include <curl/curl.h>

#include <cstdint>
#include <filesystem>
#include <string>

#include "tarvexsap/tarvex_sap.h"

namespace netbench {

struct CurlAnswer {
  long status = 0;
  std::string body;
  std::string signature;  // the "signature" header, base64
};

class CurlDevice {
 public:
  CurlDevice(std::string baseURL, const std::filesystem::path& caFile);
  ~CurlDevice();
  CurlDevice(const CurlDevice&) = delete;
  CurlDevice& operator=(const CurlDevice&) = delete;

  // Certificate, handshake request, session info: throws std::runtime_error on failure.
  void associate();
  // Signs `body`, posts it to deviceservices/<endpoint>, and for a signed answer checks its
  // signature (false if it does not verify).
  bool post(const std::string& endpoint, const std::string& body, CurlAnswer& answer);

 private:
  CurlAnswer perform(const std::string& path, const std::string* body, curl_slist* headers);

  std::string baseURL_;
  CURL* easy_ = nullptr;
  QVSAPContextOpaque_* context_ = nullptr;
  TarvexHWInfo_ hw_{};
  std::string sessionId_;  // one association per device: a second handshake under an id replaces the first
};

}  // namespace netbench

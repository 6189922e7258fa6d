#include "curl_device.h"

#include <strings.h>

#include <cstdlib>
#include <nlohmann/json.hpp>
#include <stdexcept>
#include <vector>

#include "platform/values/base64.h"
#include "platform/values/uuid.h"
#include "sap/tarvex_sap_primitives.h"

namespace netbench {

namespace {

size_t onBody(char* data, size_t size, size_t count, void* user) {
  static_cast<CurlAnswer*>(user)->body.append(data, size * count);
  return size * count;
}

size_t onHeader(char* data, size_t size, size_t count, void* user) {
  std::string line(data, size * count);
  constexpr char kName[] = "signature:";
  if (line.size() > sizeof kName - 1 && strncasecmp(line.c_str(), kName, sizeof kName - 1) == 0) {
    std::string value = line.substr(sizeof kName - 1);
    while (!value.empty() && (value.front() == ' ' || value.front() == '\t')) value.erase(0, 1);
    while (!value.empty() && (value.back() == '\r' || value.back() == '\n')) value.pop_back();
    static_cast<CurlAnswer*>(user)->signature = value;
  }
  return size * count;
}

}  // namespace

CurlDevice::CurlDevice(std::string baseURL, const std::filesystem::path& caFile)
    : baseURL_(std::move(baseURL)), sessionId_(platform::UUID().UUIDString()) {
  easy_ = curl_easy_init();
  if (!easy_) throw std::runtime_error("curl_easy_init failed");
  curl_easy_setopt(easy_, CURLOPT_CAINFO, caFile.c_str());
  curl_easy_setopt(easy_, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(easy_, CURLOPT_TCP_NODELAY, 1L);
  curl_easy_setopt(easy_, CURLOPT_WRITEFUNCTION, &onBody);
  curl_easy_setopt(easy_, CURLOPT_HEADERFUNCTION, &onHeader);
  if (TarvexSAPInit(&context_, &hw_) != kTarvexSAPOK) throw std::runtime_error("TarvexSAPInit failed");
}

CurlDevice::~CurlDevice() {
  TarvexSAPTeardown(context_);
  curl_easy_cleanup(easy_);
}

CurlAnswer CurlDevice::perform(const std::string& path, const std::string* body, curl_slist* headers) {
  CurlAnswer answer;
  const std::string url = baseURL_ + "/" + path;
  curl_easy_setopt(easy_, CURLOPT_URL, url.c_str());
  curl_easy_setopt(easy_, CURLOPT_WRITEDATA, &answer);
  curl_easy_setopt(easy_, CURLOPT_HEADERDATA, &answer);
  curl_easy_setopt(easy_, CURLOPT_HTTPHEADER, headers);
  if (body) {
    curl_easy_setopt(easy_, CURLOPT_POSTFIELDS, body->c_str());
    curl_easy_setopt(easy_, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body->size()));
  } else {
    curl_easy_setopt(easy_, CURLOPT_HTTPGET, 1L);
  }
  const CURLcode result = curl_easy_perform(easy_);
  if (result != CURLE_OK) throw std::runtime_error(std::string("curl: ") + curl_easy_strerror(result));
  curl_easy_getinfo(easy_, CURLINFO_RESPONSE_CODE, &answer.status);
  return answer;
}

void CurlDevice::associate() {
  const CurlAnswer certificate = perform("deviceservices/setup.crt", nullptr, nullptr);
  uint8_t* out = nullptr;
  uint32_t outLength = 0;
  uint8_t returnCode = 255;
  if (TarvexSAPExchange(kTarvexSAPExchangeSelector, &hw_, context_,
                        reinterpret_cast<const uint8_t*>(certificate.body.data()), certificate.body.size(), &out,
                        &outLength, &returnCode) != kTarvexSAPOK ||
      returnCode != 1)
    throw std::runtime_error("handshake request refused");
  const std::string request = platform::base64Encode(std::span<const uint8_t>(out, outLength));
  std::free(out);

  const std::string body = nlohmann::json{{"session-request", request}, {"session-identifier", sessionId_}}.dump();
  curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/json");
  headers = curl_slist_append(headers, "Expect:");
  const CurlAnswer answer = perform("deviceservices/sapSession", &body, headers);
  curl_slist_free_all(headers);
  if (answer.status != 200) throw std::runtime_error("handshake answered " + std::to_string(answer.status));
  const auto info =
      platform::base64DecodeStrict(nlohmann::json::parse(answer.body).at("session-info").get<std::string>());
  if (!info) throw std::runtime_error("session-info is not base64");
  out = nullptr;
  outLength = 0;
  returnCode = 255;
  const int32_t status = TarvexSAPExchange(kTarvexSAPExchangeSelector, &hw_, context_, info->bytes(), info->length(),
                                           &out, &outLength, &returnCode);
  std::free(out);
  if (status != kTarvexSAPOK || returnCode != 0) throw std::runtime_error("session info refused");
}

bool CurlDevice::post(const std::string& endpoint, const std::string& body, CurlAnswer& answer) {
  uint8_t* signature = nullptr;
  uint32_t signatureLength = 0;
  if (TarvexSAPSign(context_, reinterpret_cast<const uint8_t*>(body.data()), body.size(), &signature,
                    &signatureLength) != kTarvexSAPOK)
    return false;
  const std::string encoded = platform::base64Encode(std::span<const uint8_t>(signature, signatureLength));
  std::free(signature);

  curl_slist* headers = curl_slist_append(nullptr, "Content-Type: application/json");
  headers = curl_slist_append(headers, "Accept: application/json");
  headers = curl_slist_append(headers, "protocol-version: 1.0");
  headers = curl_slist_append(headers, ("session-identifier: " + sessionId_).c_str());
  headers = curl_slist_append(headers, ("signature: " + encoded).c_str());
  headers = curl_slist_append(headers, "Expect:");
  answer = perform("deviceservices/" + endpoint, &body, headers);
  curl_slist_free_all(headers);
  if (answer.status == 204) return true;  // the confirmation: nothing to verify
  if (answer.status != 200) return false;
  const auto answerSignature = platform::base64DecodeStrict(answer.signature);
  if (!answerSignature) return false;
  std::vector<uint8_t> copy(answer.body.begin(), answer.body.end());
  return TarvexSAPVerify(context_, answerSignature->bytes(), answerSignature->length(), copy.data(), copy.size()) ==
         kTarvexSAPOK;
}

}  // namespace netbench

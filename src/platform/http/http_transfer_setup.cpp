// A task's libcurl transfer: its options and the callbacks that feed the body out and collect
// the answer.
#include <algorithm>
#include <cstring>
#include <string_view>

#include "platform/http/http_transfer.h"

namespace platform {

namespace {

// Servers close idle connections after their keep-alive time (5 s is common); one older than
// that is not reused, which spares most requests a send into a closed connection.
constexpr long kMaximumIdleSeconds = 4;

size_t onBody(char* data, size_t size, size_t count, void* user) {
  auto* task = static_cast<HTTPTaskState*>(user);
  size_t n = size * count;
  if (task->received.size() + n > task->maximumResponseSize) return 0;  // fails the transfer
  task->received.insert(task->received.end(), data, data + n);
  return n;
}

size_t onUpload(char* buffer, size_t size, size_t count, void* user) {
  auto* task = static_cast<HTTPTaskState*>(user);
  size_t n = std::min(size * count, task->body->length() - task->uploaded);
  if (n > 0) std::memcpy(buffer, task->body->bytes() + task->uploaded, n);
  task->uploaded += n;
  return n;
}

size_t onHeader(char* data, size_t size, size_t count, void* user) {
  auto* task = static_cast<HTTPTaskState*>(user);
  size_t n = size * count;
  std::string_view line(data, n);
  while (!line.empty() && (line.back() == '\r' || line.back() == '\n')) line.remove_suffix(1);
  if (line.starts_with("HTTP/")) {
    task->responseHeaders.clear();  // a new response block (after an interim 1xx answer)
  } else if (auto colon = line.find(':'); colon != std::string_view::npos) {
    // Optional white space around a field value is not part of it.
    std::string_view value = line.substr(colon + 1);
    while (!value.empty() && (value.front() == ' ' || value.front() == '\t')) value.remove_prefix(1);
    while (!value.empty() && (value.back() == ' ' || value.back() == '\t')) value.remove_suffix(1);
    task->responseHeaders.emplace_back(std::string(line.substr(0, colon)), std::string(value));
  }
  return n;
}

// The request's header fields as libcurl takes them, one "Name: value" line each; false when an
// entry cannot be allocated.
bool buildHeaderList(HTTPTaskState& t) {
  CurlSlistPtr list;
  std::string line;
  for (const auto& [name, value] : t.request.headerFields) {
    line.assign(name).append(": ").append(value);
    if (!curlSlistAppend(list, line.c_str())) return false;
  }
  if (!curlSlistAppend(list, "Expect:")) return false;  // no 100-continue round trip for bodies
  t.headers = std::move(list);
  return true;
}

}  // namespace

bool configureTransfer(HTTPTaskState& t, const HTTPSessionConfiguration& configuration, int64_t capMs) {
  if (!buildHeaderList(t)) return false;
  t.maximumResponseSize = configuration.maximumResponseSize;
  CURL* e = t.easy.get();
  curl_easy_setopt(e, CURLOPT_URL, t.request.URL.c_str());
  curl_easy_setopt(e, CURLOPT_PRIVATE, &t);
  curl_easy_setopt(e, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(e, CURLOPT_PROTOCOLS_STR, "https");
  curl_easy_setopt(e, CURLOPT_SSL_VERIFYPEER, 1L);
  curl_easy_setopt(e, CURLOPT_SSL_VERIFYHOST, 2L);
  if (!configuration.caFile.empty()) curl_easy_setopt(e, CURLOPT_CAINFO, configuration.caFile.c_str());
  curl_easy_setopt(e, CURLOPT_ERRORBUFFER, t.errorBuffer);
  curl_easy_setopt(e, CURLOPT_WRITEFUNCTION, &onBody);
  curl_easy_setopt(e, CURLOPT_WRITEDATA, &t);
  curl_easy_setopt(e, CURLOPT_HEADERFUNCTION, &onHeader);
  curl_easy_setopt(e, CURLOPT_HEADERDATA, &t);
  int64_t timeoutMs = t.request.timeoutInterval > 0 ? static_cast<int64_t>(t.request.timeoutInterval * 1000.0) : 0;
  if (capMs > 0 && (timeoutMs == 0 || timeoutMs > capMs)) timeoutMs = capMs;
  curl_easy_setopt(e, CURLOPT_TIMEOUT_MS, static_cast<long>(timeoutMs));

  if (t.request.HTTPMethod == "GET") {
    curl_easy_setopt(e, CURLOPT_HTTPGET, 1L);
  } else if (t.request.HTTPMethod == "POST") {
    curl_easy_setopt(e, CURLOPT_POST, 1L);
  } else {
    curl_easy_setopt(e, CURLOPT_CUSTOMREQUEST, t.request.HTTPMethod.c_str());
  }
  curl_easy_setopt(e, CURLOPT_MAXAGE_CONN, kMaximumIdleSeconds);
  if (t.resent) curl_easy_setopt(e, CURLOPT_FRESH_CONNECT, 1L);
  if (t.body) {
    curl_easy_setopt(e, CURLOPT_POST, 1L);
    curl_easy_setopt(e, CURLOPT_READFUNCTION, &onUpload);
    curl_easy_setopt(e, CURLOPT_READDATA, &t);
    curl_easy_setopt(e, CURLOPT_SEEKFUNCTION, &rewindForResend);
    curl_easy_setopt(e, CURLOPT_SEEKDATA, &t);
    curl_easy_setopt(e, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(t.body->length()));
  } else if (t.request.HTTPMethod == "POST") {
    curl_easy_setopt(e, CURLOPT_POSTFIELDS, "");
    curl_easy_setopt(e, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(0));
  }
  curl_easy_setopt(e, CURLOPT_HTTPHEADER, t.headers.get());
  return true;
}

}  // namespace platform

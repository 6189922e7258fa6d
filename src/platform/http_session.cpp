#include "platform/http_session.h"

#include <curl/curl.h>

#include <algorithm>
#include <atomic>
#include <cstring>
#include <deque>
#include <map>
#include <mutex>
#include <system_error>
#include <thread>
#include <vector>

#include "platform/configuration.h"
#include "platform/semaphore.h"

namespace platform {

namespace {

std::atomic<int64_t> gMaximumTimeoutMs{0};  // 0: no cap
constexpr long kMaximumIdleSeconds = 4;

void globalInit() {
  static std::once_flag once;
  std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
}

Error transportError(CURLcode code, const std::string& detail, const std::string& url) {
  int64_t errorCode = HTTPErrorUnknown;
  std::string text;
  switch (code) {
    case CURLE_OPERATION_TIMEDOUT:
      errorCode = HTTPErrorTimedOut;
      text = "The request timed out.";
      break;
    case CURLE_COULDNT_CONNECT:
    case CURLE_COULDNT_RESOLVE_HOST:
    case CURLE_COULDNT_RESOLVE_PROXY:
      errorCode = HTTPErrorCannotConnectToHost;
      text = "Could not connect to the server.";
      break;
    case CURLE_URL_MALFORMAT:
    case CURLE_UNSUPPORTED_PROTOCOL:
      errorCode = HTTPErrorBadURL;
      text = "unsupported URL";
      break;
    case CURLE_GOT_NOTHING:
    case CURLE_RECV_ERROR:
    case CURLE_SEND_ERROR:
    case CURLE_SEND_FAIL_REWIND:
    case CURLE_PARTIAL_FILE:
      errorCode = HTTPErrorNetworkConnectionLost;
      text = "The network connection was lost.";
      break;
    case CURLE_WRITE_ERROR:
      errorCode = HTTPErrorResourceTooLarge;
      text = "The answer exceeds the maximum size.";
      break;
    case CURLE_PEER_FAILED_VERIFICATION:
    case CURLE_SSL_CONNECT_ERROR:
    case CURLE_SSL_CERTPROBLEM:
    case CURLE_SSL_CACERT_BADFILE:
    case CURLE_SSL_CIPHER:
      errorCode = HTTPErrorSecureConnectionFailed;
      text = "A TLS error occurred and a secure connection to the server cannot be made.";
      break;
    default:
      text = curl_easy_strerror(code);
      break;
  }
  if (!detail.empty()) text += " (" + detail + ")";
  return Error(
      HTTPErrorDomain, errorCode,
      Dictionary{{LocalizedDescriptionKey, text}, {"FailingURL", url}, {"TransportCode", static_cast<int64_t>(code)}});
}

Error cancelledError(const std::string& url) {
  return Error(HTTPErrorDomain, HTTPErrorCancelled,
               Dictionary{{LocalizedDescriptionKey, "cancelled"}, {"FailingURL", url}});
}

}  // namespace

class ConnectionClaim {
 public:
  explicit ConnectionClaim(std::shared_ptr<Semaphore> claims) : claims_(std::move(claims)) {}
  ConnectionClaim(const ConnectionClaim&) = delete;
  ConnectionClaim& operator=(const ConnectionClaim&) = delete;
  ~ConnectionClaim() { claims_->signal(); }

 private:
  std::shared_ptr<Semaphore> claims_;
};

struct HTTPTaskState {
  HTTPRequest request;
  std::optional<Data> body;
  HTTPCompletion completion;
  std::shared_ptr<ConnectionClaim> claim;  // given back when the task completes
  std::weak_ptr<HTTPSession::Engine> engine;
  std::atomic<bool> started{false};
  std::atomic<bool> finished{false};

  // Owned by the worker thread while the transfer runs.
  CURL* easy = nullptr;
  curl_slist* headers = nullptr;
  size_t uploaded = 0;  // body bytes handed to libcurl so far
  bool resent = false;  // the request went out a second time, on a fresh connection
  std::vector<uint8_t> received;
  HTTPHeaderFields responseHeaders;
  char errorBuffer[CURL_ERROR_SIZE] = {};
  size_t maximumResponseSize = 0;
};

class HTTPSession::Engine : public std::enable_shared_from_this<HTTPSession::Engine> {
 public:
  explicit Engine(HTTPSessionConfiguration configuration)
      : configuration_(std::move(configuration)),
        callbackQueue_(Queue::serial(configuration_.label + ".callbackQueue")),
        claims_(std::make_shared<Semaphore>(configuration_.maximumConnectionsPerHost)) {
    globalInit();
    multi_ = curl_multi_init();
    // The idle cache keeps every connection the bound allows, for each of the two servers (API and
    // static content) a session talks to: a smaller cache closes connections that the next
    // request would have reused.
    curl_multi_setopt(multi_, CURLMOPT_MAX_HOST_CONNECTIONS, configuration_.maximumConnectionsPerHost);
    curl_multi_setopt(multi_, CURLMOPT_MAXCONNECTS, 2 * configuration_.maximumConnectionsPerHost);
  }

  std::shared_ptr<ConnectionClaim> claimConnection() {
    claims_->wait();
    return std::make_shared<ConnectionClaim>(claims_);
  }

  ~Engine() {
    stop();
    curl_multi_cleanup(multi_);
  }

  const std::shared_ptr<Queue>& callbackQueue() const { return callbackQueue_; }

  void submit(const std::shared_ptr<HTTPTaskState>& task) {
    bool stopping;
    {
      std::lock_guard lock(mutex_);
      stopping = stopping_;
      if (!stopping && startWorker()) {
        toAdd_.push_back(task);
        curl_multi_wakeup(multi_);
        return;
      }
    }
    complete(task, std::nullopt, std::nullopt,
             stopping ? cancelledError(task->request.URL)
                      : transportError(CURLE_OUT_OF_MEMORY, "no thread could be started for the transfer",
                                       task->request.URL));
  }

  void cancel(const std::shared_ptr<HTTPTaskState>& task) {
    std::lock_guard lock(mutex_);
    toCancel_.push_back(task);
    curl_multi_wakeup(multi_);
  }

  // Starts the worker now if a thread is to be had; otherwise the first task tries again.
  void prepare() {
    std::lock_guard lock(mutex_);
    startWorker();
  }

  // Called with mutex_ held. The worker starts with the first task, and with a later one when it
  // could not start before: a shortage of threads fails the transfers concerned, never the process.
  bool startWorker() {
    if (worker_.joinable()) return true;
    try {
      worker_ = std::thread([this] { run(); });
      return true;
    } catch (const std::system_error&) {
      return false;
    }
  }

  void stop() {
    {
      std::lock_guard lock(mutex_);
      if (stopping_) return;
      stopping_ = true;
      curl_multi_wakeup(multi_);
    }
    if (worker_.joinable()) {
      if (worker_.get_id() == std::this_thread::get_id())
        worker_.detach();
      else
        worker_.join();
    }
  }

  void complete(const std::shared_ptr<HTTPTaskState>& task, std::optional<Data> body,
                std::optional<HTTPResponse> response, std::optional<Error> error) {
    if (task->finished.exchange(true)) return;
    task->claim.reset();
    HTTPCompletion completion = std::move(task->completion);
    if (!completion) return;
    callbackQueue_->async([completion = std::move(completion), body = std::move(body), response = std::move(response),
                           error = std::move(error)] { completion(body, response, error); });
  }

 private:
  static size_t onBody(char* data, size_t size, size_t count, void* user) {
    auto* task = static_cast<HTTPTaskState*>(user);
    size_t n = size * count;
    if (task->received.size() + n > task->maximumResponseSize) return 0;  // fails the transfer
    task->received.insert(task->received.end(), data, data + n);
    return n;
  }

  static size_t onUpload(char* buffer, size_t size, size_t count, void* user) {
    auto* task = static_cast<HTTPTaskState*>(user);
    size_t n = std::min(size * count, task->body->length() - task->uploaded);
    if (n > 0) std::memcpy(buffer, task->body->bytes() + task->uploaded, n);
    task->uploaded += n;
    return n;
  }

  // libcurl rewinds a body only to send the request again on a fresh connection, when the reused one
  // it went out on turned out dead before any byte of an answer arrived; once at most, counting
  // the sends that `shouldResend` makes.
  static int onSeek(void* user, curl_off_t offset, int origin) {
    auto* task = static_cast<HTTPTaskState*>(user);
    if (offset != 0 || origin != SEEK_SET || task->resent) return CURL_SEEKFUNC_CANTSEEK;
    task->resent = true;
    task->uploaded = 0;
    return CURL_SEEKFUNC_OK;
  }

  // A reused connection that the server had closed fails the send itself, or ends before any
  // answer: the server never saw the request, which may go out once more on a fresh connection.
  static bool shouldResend(HTTPTaskState& t, CURLcode result) {
    if (t.resent || (result != CURLE_SEND_ERROR && result != CURLE_RECV_ERROR && result != CURLE_GOT_NOTHING))
      return false;
    long connects = -1, headerBytes = -1;
    curl_easy_getinfo(t.easy, CURLINFO_NUM_CONNECTS, &connects);
    curl_easy_getinfo(t.easy, CURLINFO_HEADER_SIZE, &headerBytes);
    return connects == 0 && headerBytes == 0 && t.received.empty();
  }

  // Configures the task's transfer and hands it to libcurl; false (the task released) if it cannot.
  bool start(const std::shared_ptr<HTTPTaskState>& task, std::map<CURL*, std::shared_ptr<HTTPTaskState>>& active) {
    if (!configure(*task) || curl_multi_add_handle(multi_, task->easy) != CURLM_OK) {
      release(*task);
      return false;
    }
    active.emplace(task->easy, task);
    return true;
  }

  static size_t onHeader(char* data, size_t size, size_t count, void* user) {
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

  bool configure(HTTPTaskState& t) {
    t.easy = curl_easy_init();
    if (!t.easy) return false;
    t.maximumResponseSize = configuration_.maximumResponseSize;
    CURL* e = t.easy;
    curl_easy_setopt(e, CURLOPT_URL, t.request.URL.c_str());
    curl_easy_setopt(e, CURLOPT_PRIVATE, &t);
    curl_easy_setopt(e, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(e, CURLOPT_PROTOCOLS_STR, "https");
    curl_easy_setopt(e, CURLOPT_SSL_VERIFYPEER, 1L);
    curl_easy_setopt(e, CURLOPT_SSL_VERIFYHOST, 2L);
    if (!configuration_.caFile.empty()) curl_easy_setopt(e, CURLOPT_CAINFO, configuration_.caFile.c_str());
    curl_easy_setopt(e, CURLOPT_ERRORBUFFER, t.errorBuffer);
    curl_easy_setopt(e, CURLOPT_WRITEFUNCTION, &Engine::onBody);
    curl_easy_setopt(e, CURLOPT_WRITEDATA, &t);
    curl_easy_setopt(e, CURLOPT_HEADERFUNCTION, &Engine::onHeader);
    curl_easy_setopt(e, CURLOPT_HEADERDATA, &t);
    int64_t timeoutMs = t.request.timeoutInterval > 0 ? static_cast<int64_t>(t.request.timeoutInterval * 1000.0) : 0;
    int64_t cap = gMaximumTimeoutMs.load();
    if (cap > 0 && (timeoutMs == 0 || timeoutMs > cap)) timeoutMs = cap;
    curl_easy_setopt(e, CURLOPT_TIMEOUT_MS, static_cast<long>(timeoutMs));

    if (t.request.HTTPMethod == "GET") {
      curl_easy_setopt(e, CURLOPT_HTTPGET, 1L);
    } else if (t.request.HTTPMethod == "POST") {
      curl_easy_setopt(e, CURLOPT_POST, 1L);
    } else {
      curl_easy_setopt(e, CURLOPT_CUSTOMREQUEST, t.request.HTTPMethod.c_str());
    }
    // Servers close idle connections after their keep-alive time (5 s is common); one older than
    // that is not reused, which spares most requests a send into a closed connection.
    curl_easy_setopt(e, CURLOPT_MAXAGE_CONN, kMaximumIdleSeconds);
    if (t.resent) curl_easy_setopt(e, CURLOPT_FRESH_CONNECT, 1L);
    if (t.body) {
      curl_easy_setopt(e, CURLOPT_POST, 1L);
      curl_easy_setopt(e, CURLOPT_READFUNCTION, &Engine::onUpload);
      curl_easy_setopt(e, CURLOPT_READDATA, &t);
      curl_easy_setopt(e, CURLOPT_SEEKFUNCTION, &Engine::onSeek);
      curl_easy_setopt(e, CURLOPT_SEEKDATA, &t);
      curl_easy_setopt(e, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(t.body->length()));
    } else if (t.request.HTTPMethod == "POST") {
      curl_easy_setopt(e, CURLOPT_POSTFIELDS, "");
      curl_easy_setopt(e, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(0));
    }
    for (const auto& [name, value] : t.request.headerFields)
      t.headers = curl_slist_append(t.headers, (name + ": " + value).c_str());
    t.headers = curl_slist_append(t.headers, "Expect:");  // no 100-continue round trip for bodies
    curl_easy_setopt(e, CURLOPT_HTTPHEADER, t.headers);
    return true;
  }

  void finish(const std::shared_ptr<HTTPTaskState>& task, CURLcode result) {
    std::optional<Data> body;
    std::optional<HTTPResponse> response;
    std::optional<Error> error;
    if (result == CURLE_OK) {
      HTTPResponse r;
      curl_easy_getinfo(task->easy, CURLINFO_RESPONSE_CODE, &r.statusCode);
      char* effective = nullptr;
      curl_easy_getinfo(task->easy, CURLINFO_EFFECTIVE_URL, &effective);
      r.URL = effective ? effective : task->request.URL;
      r.headerFields = std::move(task->responseHeaders);
      response = std::move(r);
      body = Data(std::move(task->received));
    } else {
      error = transportError(result, task->errorBuffer, task->request.URL);
    }
    release(*task);
    complete(task, std::move(body), std::move(response), std::move(error));
  }

  void release(HTTPTaskState& t) {
    if (t.easy) {
      curl_multi_remove_handle(multi_, t.easy);
      curl_easy_cleanup(t.easy);
      t.easy = nullptr;
    }
    curl_slist_free_all(t.headers);
    t.headers = nullptr;
  }

  void run() {
    std::map<CURL*, std::shared_ptr<HTTPTaskState>> active;
    for (;;) {
      std::deque<std::shared_ptr<HTTPTaskState>> adds, cancels;
      bool stopping;
      {
        std::lock_guard lock(mutex_);
        adds.swap(toAdd_);
        cancels.swap(toCancel_);
        stopping = stopping_;
      }
      if (stopping) {
        for (auto& [easy, task] : active) {
          release(*task);
          complete(task, std::nullopt, std::nullopt, cancelledError(task->request.URL));
        }
        for (auto& task : adds) complete(task, std::nullopt, std::nullopt, cancelledError(task->request.URL));
        return;
      }
      for (auto& task : adds)
        if (!task->finished && !start(task, active))
          complete(task, std::nullopt, std::nullopt, transportError(CURLE_FAILED_INIT, "", task->request.URL));
      for (auto& task : cancels) {
        auto it = task->easy ? active.find(task->easy) : active.end();
        if (it != active.end()) {
          active.erase(it);
          release(*task);
        }
        complete(task, std::nullopt, std::nullopt, cancelledError(task->request.URL));
      }
      int running = 0;
      curl_multi_perform(multi_, &running);
      int left = 0;
      while (CURLMsg* msg = curl_multi_info_read(multi_, &left)) {
        if (msg->msg != CURLMSG_DONE) continue;
        auto it = active.find(msg->easy_handle);
        if (it == active.end()) continue;
        auto task = it->second;
        CURLcode result = msg->data.result;
        active.erase(it);
        if (shouldResend(*task, result)) {
          release(*task);
          task->resent = true;
          task->uploaded = 0;
          task->responseHeaders.clear();
          if (start(task, active)) continue;
        }
        finish(task, result);
      }
      curl_multi_poll(multi_, nullptr, 0, 1000, nullptr);
    }
  }

  HTTPSessionConfiguration configuration_;
  std::shared_ptr<Queue> callbackQueue_;
  std::shared_ptr<Semaphore> claims_;
  CURLM* multi_ = nullptr;
  std::mutex mutex_;
  std::deque<std::shared_ptr<HTTPTaskState>> toAdd_, toCancel_;
  bool stopping_ = false;
  std::thread worker_;
};

HTTPSessionConfiguration HTTPSessionConfiguration::defaultSessionConfiguration() {
  HTTPSessionConfiguration c;
  c.caFile = currentConfiguration()->caFile;
  c.label = "HTTPSession.shared";
  return c;
}

HTTPSessionConfiguration HTTPSessionConfiguration::ephemeralSessionConfiguration() {
  HTTPSessionConfiguration c;
  c.caFile = currentConfiguration()->caFile;
  c.label = "HTTPSession.ephemeral";
  return c;
}

void HTTPTask::resume() {
  if (state_->started.exchange(true)) return;
  if (auto engine = state_->engine.lock()) engine->submit(state_);
}

void HTTPTask::cancel() {
  auto engine = state_->engine.lock();
  if (!engine || state_->finished) return;
  if (state_->started)
    engine->cancel(state_);
  else
    engine->complete(state_, std::nullopt, std::nullopt, cancelledError(state_->request.URL));
}

const HTTPRequest& HTTPTask::originalRequest() const { return state_->request; }

HTTPSession::HTTPSession(HTTPSessionConfiguration configuration)
    : engine_(std::make_shared<Engine>(std::move(configuration))) {
  engine_->prepare();
}

HTTPSession::~HTTPSession() { engine_->stop(); }

std::shared_ptr<HTTPSession> HTTPSession::sessionWithConfiguration(HTTPSessionConfiguration configuration) {
  return std::shared_ptr<HTTPSession>(new HTTPSession(std::move(configuration)));
}

std::shared_ptr<HTTPSession> HTTPSession::sharedSession() {
  static std::shared_ptr<HTTPSession> shared =
      sessionWithConfiguration(HTTPSessionConfiguration::defaultSessionConfiguration());
  return shared;
}

std::shared_ptr<HTTPTask> HTTPSession::uploadTaskWithRequest(HTTPRequest request, Data body, HTTPCompletion completion,
                                                             std::shared_ptr<ConnectionClaim> claim) {
  auto state = std::make_shared<HTTPTaskState>();
  state->request = std::move(request);
  state->body = std::move(body);
  state->completion = std::move(completion);
  state->claim = std::move(claim);
  state->engine = engine_;
  return std::shared_ptr<HTTPTask>(new HTTPTask(std::move(state)));
}

std::shared_ptr<HTTPTask> HTTPSession::dataTaskWithRequest(HTTPRequest request, HTTPCompletion completion) {
  auto state = std::make_shared<HTTPTaskState>();
  state->request = std::move(request);
  state->completion = std::move(completion);
  state->engine = engine_;
  return std::shared_ptr<HTTPTask>(new HTTPTask(std::move(state)));
}

std::shared_ptr<ConnectionClaim> HTTPSession::claimConnection() { return engine_->claimConnection(); }

void HTTPSession::invalidateAndCancel() { engine_->stop(); }

const std::shared_ptr<Queue>& HTTPSession::callbackQueue() const { return engine_->callbackQueue(); }

void HTTPSession::setMaximumTimeout(std::optional<std::chrono::milliseconds> cap) {
  gMaximumTimeoutMs.store(cap ? std::max<int64_t>(1, cap->count()) : 0);
}

}  // namespace platform

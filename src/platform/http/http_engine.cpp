#include "platform/http/http_engine.h"

#include <system_error>

namespace platform {

namespace {

void globalInit() {
  static std::once_flag once;
  std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
}

// As many reset handles as a session's connections may be busy at once are kept for the next
// transfers: a handle made anew costs more than the request it carries.
constexpr size_t kSpareHandles = 32;

}  // namespace

HTTPSession::Engine::Engine(HTTPSessionConfiguration configuration)
    : configuration_(std::move(configuration)),
      callbackQueue_(Queue::serial(configuration_.label + ".callbackQueue")),
      claims_(std::make_shared<Semaphore>(configuration_.maximumConnectionsPerHost)) {
  globalInit();
  // Out of memory leaves multi_ null: every task then fails with a transport error.
  multi_.reset(curl_multi_init());
  // The idle cache keeps every connection the bound allows, for each of the two servers (API and
  // static content) a session talks to: a smaller cache closes connections that the next
  // request would have reused.
  curl_multi_setopt(multi_.get(), CURLMOPT_MAX_HOST_CONNECTIONS, configuration_.maximumConnectionsPerHost);
  curl_multi_setopt(multi_.get(), CURLMOPT_MAXCONNECTS, 2 * configuration_.maximumConnectionsPerHost);
}

HTTPSession::Engine::~Engine() {
  stop();
  spareHandles_.clear();  // before the multi handle whose connection cache they used
}

std::atomic<int64_t>& HTTPSession::Engine::maximumTimeoutMs() {
  static std::atomic<int64_t> cap{0};
  return cap;
}

std::shared_ptr<ConnectionClaim> HTTPSession::Engine::claimConnection() {
  claims_->wait();
  return std::make_shared<ConnectionClaim>(claims_);
}

void HTTPSession::Engine::submit(const std::shared_ptr<HTTPTaskState>& task) {
  bool stopping;
  bool added = false;
  {
    std::lock_guard lock(mutex_);
    stopping = stopping_;
    if (!stopping && multi_ && startWorker()) {
      toAdd_.push_back(task);
      added = true;
    }
  }
  // Woken outside the lock, so that the event thread does not wake only to wait for it.
  if (added) {
    curl_multi_wakeup(multi_.get());
    return;
  }
  const char* why = multi_ ? "no thread could be started for the transfer" : "libcurl could not make its multi handle";
  complete(task, HTTPOutcome::failure(stopping ? cancelledError(task->request.URL)
                                               : transportError(CURLE_OUT_OF_MEMORY, why, task->request.URL)));
}

void HTTPSession::Engine::cancel(const std::shared_ptr<HTTPTaskState>& task) {
  {
    std::lock_guard lock(mutex_);
    toCancel_.push_back(task);
  }
  curl_multi_wakeup(multi_.get());
}

void HTTPSession::Engine::prepare() {
  std::lock_guard lock(mutex_);
  if (multi_) startWorker();
}

// The event thread starts with the first task, and with a later one when it could not start
// before: a shortage of threads fails the transfers concerned, never the process.
bool HTTPSession::Engine::startWorker() {
  if (worker_.joinable()) return true;
  try {
    worker_ = std::thread([this] { run(); });
    return true;
  } catch (const std::system_error&) {
    return false;
  }
}

void HTTPSession::Engine::stop() {
  {
    std::lock_guard lock(mutex_);
    if (stopping_) return;
    stopping_ = true;
    curl_multi_wakeup(multi_.get());
  }
  if (worker_.joinable()) {
    if (worker_.get_id() == std::this_thread::get_id())
      worker_.detach();
    else
      worker_.join();
  }
}

void HTTPSession::Engine::complete(const std::shared_ptr<HTTPTaskState>& task, HTTPOutcome outcome) {
  if (task->finished.exchange(true)) return;
  task->claim.reset();
  HTTPCompletion completion = std::move(task->completion);
  if (!completion) return;
  // The completion runs once: what it is given is moved to it, not copied.
  callbackQueue_->async([completion = std::move(completion), outcome = std::move(outcome)]() mutable {
    completion(std::move(outcome.body), std::move(outcome.response), std::move(outcome.error));
  });
}

// Configures the task's transfer, on a spare handle when there is one, and hands it to libcurl;
// false (the task released) if it cannot.
bool HTTPSession::Engine::start(const std::shared_ptr<HTTPTaskState>& task, Active& active) {
  if (!spareHandles_.empty()) {
    task->easy = std::move(spareHandles_.back());
    spareHandles_.pop_back();
    curl_easy_reset(task->easy.get());
  } else {
    task->easy.reset(curl_easy_init());
  }
  if (!task->easy || !configureTransfer(*task, configuration_, maximumTimeoutMs().load()) ||
      curl_multi_add_handle(multi_.get(), task->easy.get()) != CURLM_OK) {
    release(*task);
    return false;
  }
  active.emplace(task->easy.get(), task);
  return true;
}

void HTTPSession::Engine::release(HTTPTaskState& t) {
  if (t.easy) {
    curl_multi_remove_handle(multi_.get(), t.easy.get());
    if (spareHandles_.size() < kSpareHandles) spareHandles_.push_back(std::move(t.easy));
    t.easy.reset();
  }
  t.headers.reset();
}

void HTTPSession::Engine::finish(const std::shared_ptr<HTTPTaskState>& task, CURLcode result) {
  HTTPOutcome outcome = transferOutcome(*task, result);
  release(*task);
  complete(task, std::move(outcome));
}

void HTTPSession::Engine::cancelEverything(Active& active, Tasks& adds) {
  for (auto& [easy, task] : active) {
    release(*task);
    complete(task, HTTPOutcome::failure(cancelledError(task->request.URL)));
  }
  for (auto& task : adds) complete(task, HTTPOutcome::failure(cancelledError(task->request.URL)));
}

void HTTPSession::Engine::startAdded(Tasks& adds, Active& active) {
  for (auto& task : adds)
    if (!task->finished && !start(task, active))
      complete(task, HTTPOutcome::failure(transportError(CURLE_FAILED_INIT, "", task->request.URL)));
}

void HTTPSession::Engine::cancelRequested(Tasks& cancels, Active& active) {
  for (auto& task : cancels) {
    auto it = task->easy ? active.find(task->easy.get()) : active.end();
    if (it != active.end()) {
      active.erase(it);
      release(*task);
    }
    complete(task, HTTPOutcome::failure(cancelledError(task->request.URL)));
  }
}

void HTTPSession::Engine::collectFinished(Active& active) {
  int left = 0;
  while (CURLMsg* msg = curl_multi_info_read(multi_.get(), &left)) {
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
}

void HTTPSession::Engine::run() {
  Active active;
  for (;;) {
    Tasks adds, cancels;
    bool stopping;
    {
      std::lock_guard lock(mutex_);
      adds.swap(toAdd_);
      cancels.swap(toCancel_);
      stopping = stopping_;
    }
    if (stopping) return cancelEverything(active, adds);
    startAdded(adds, active);
    cancelRequested(cancels, active);
    int running = 0;
    curl_multi_perform(multi_.get(), &running);
    collectFinished(active);
    curl_multi_poll(multi_.get(), nullptr, 0, 1000, nullptr);
  }
}

}  // namespace platform

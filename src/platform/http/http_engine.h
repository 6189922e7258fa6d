// The engine behind an HTTPSession: one libcurl multi handle driven by one event thread, which
// starts each task's transfer, resends it when the resend rule allows, and hands its outcome to the
// session's callback queue. Private to the http facility.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/dispatch/queue.h"
#include "platform/dispatch/semaphore.h"
#include "platform/http/curl_handles.h"
#include "platform/http/http_session.h"
#include "platform/http/http_transfer.h"

namespace platform {

class HTTPSession::Engine : public std::enable_shared_from_this<HTTPSession::Engine> {
 public:
  // Engine makes the session's callback queue, connection claims and multi handle; the event thread
  // starts with prepare() or the first task.
  explicit Engine(HTTPSessionConfiguration configuration);
  // Stops the event thread; every task still running completes with HTTPErrorCancelled.
  ~Engine();

  // The time-out cap of every transfer configured from now on, in ms (0: none).
  static std::atomic<int64_t>& maximumTimeoutMs();

  // claimConnection waits, as blocking work, for one of the session's connection claims.
  std::shared_ptr<ConnectionClaim> claimConnection();
  // callbackQueue is the serial queue the completions run on, shared with the session.
  const std::shared_ptr<Queue>& callbackQueue() const { return callbackQueue_; }

  // submit hands a resumed task to the event thread; the task completes with an error when the
  // engine is stopping, has no multi handle, or no thread can be started for it.
  void submit(const std::shared_ptr<HTTPTaskState>& task);
  // cancel has the event thread end a submitted task with HTTPErrorCancelled.
  void cancel(const std::shared_ptr<HTTPTaskState>& task);
  // prepare starts the event thread now if a thread is to be had; otherwise the first task tries.
  void prepare();
  // stop cancels every task and refuses new ones; it joins the event thread unless called on it.
  void stop();
  // complete calls the task's completion on the callback queue, once, whatever calls it later.
  void complete(const std::shared_ptr<HTTPTaskState>& task, HTTPOutcome outcome);

 private:
  using Active = std::unordered_map<CURL*, std::shared_ptr<HTTPTaskState>>;
  using Tasks = std::deque<std::shared_ptr<HTTPTaskState>>;

  // Called with mutex_ held.
  bool startWorker();
  void run();
  bool start(const std::shared_ptr<HTTPTaskState>& task, Active& active);
  void release(HTTPTaskState& t);
  void finish(const std::shared_ptr<HTTPTaskState>& task, CURLcode result);
  // The steps of one turn of the event thread's loop.
  void cancelEverything(Active& active, Tasks& adds);
  void startAdded(Tasks& adds, Active& active);
  void cancelRequested(Tasks& cancels, Active& active);
  void collectFinished(Active& active);

  HTTPSessionConfiguration configuration_;
  std::shared_ptr<Queue> callbackQueue_;
  std::shared_ptr<Semaphore> claims_;
  CurlMultiPtr multi_;
  std::mutex mutex_;
  Tasks toAdd_, toCancel_;
  bool stopping_ = false;
  std::thread worker_;
  std::vector<CurlEasyPtr> spareHandles_;  // the event thread's, reset and used again
};

}  // namespace platform

#include "platform/http/http_session.h"

#include <algorithm>

#include "platform/config/configuration.h"
#include "platform/http/http_engine.h"

namespace platform {

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
    engine->complete(state_, HTTPOutcome::failure(cancelledError(state_->request.URL)));
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
  Engine::maximumTimeoutMs().store(cap ? std::max<int64_t>(1, cap->count()) : 0);
}

}  // namespace platform

#include "network/answer_check.h"

#include <string>

#include "platform/values/json.h"

using platform::LogLevel;

namespace answer_check {

namespace {

void logArrival(const Answer& answer, bool showBody) {
  const std::optional<platform::Data>& body = answer.body;
  platform::log(LogLevel::Debug, "[#TokenAuth] response: %@", *answer.response);
  platform::log(LogLevel::Debug, "[#TokenAuth] responseData.length: %lu", body ? body->length() : 0);
  if (showBody && body && !body->empty())
    platform::log(LogLevel::Debug, "[#TokenAuth] responseData (string): %{private}@", body->view());
}

void logRefusedStatus(const Answer& answer, bool showBody) {
  long status = answer.response->statusCode;
  if (!showBody) {
    platform::log(LogLevel::Error, "[#TokenAuth] Server responded with invalid HTTP status code: %ld!", status);
    return;
  }
  platform::log(LogLevel::Error,
                "[#TokenAuth] Server responded with invalid HTTP status code: %ld!\nresponseData (string): %@", status,
                answer.body ? std::string(answer.body->view()) : std::string());
}

}  // namespace

std::optional<AnswerFault> checkAnswer(const Answer& answer, const AnswerRules& rules) {
  if (answer.taskError || !answer.response) {
    platform::log(LogLevel::Fault, "[#TokenAuth] taskError: %@", answer.taskError);
    return AnswerFault::Transport;
  }
  logArrival(answer, rules.showBody);
  long status = answer.response->statusCode;
  if (rules.acceptNoContent && status == 204) return std::nullopt;
  if (status != 200) {
    logRefusedStatus(answer, rules.statusLineShowsBody);
    return AnswerFault::Status;
  }
  if (rules.requireBody && (!answer.body || answer.body->empty())) {
    platform::log(rules.emptyBodyLevel, "[#TokenAuth] responseData is empty!");
    return AnswerFault::Empty;
  }
  return std::nullopt;
}

std::optional<platform::Value> parseAnswer(const platform::Data& body) {
  platform::Result<platform::Value> parsed = platform::json::parse(body.view());
  if (!parsed) {
    platform::log(LogLevel::Error, "[#TokenAuth] responseJSONError: %@", parsed.error());
    return std::nullopt;
  }
  platform::log(LogLevel::Debug, "[#TokenAuth] responseDict: %{private}@", *parsed);
  return std::move(parsed).value();
}

}  // namespace answer_check

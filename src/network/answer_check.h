// The answer side of every exchange with a device-services server: the checks an answer goes
// through before its content is judged (it arrived, its status is accepted, it has a body) and
// its parsing as JSON. The four exchanges differ only in the rules below, which their callers
// name; each caller maps a fault to its own error domain and code.
#pragma once

#include <optional>

#include "platform/http/http_message.h"
#include "platform/log/log.h"
#include "platform/values/data.h"
#include "platform/values/error.h"
#include "platform/values/value.h"

namespace answer_check {

// What an HTTP task hands its completion handler, borrowed.
struct Answer {
  const std::optional<platform::Data>& body;
  const std::optional<platform::HTTPResponse>& response;
  const std::optional<platform::Error>& taskError;
};

enum class AnswerFault { Transport, Status, Empty };

struct AnswerRules {
  bool acceptNoContent = false;      // 204 is a success too
  bool requireBody = true;           // a success without a body is a fault
  bool showBody = true;              // the body's text among the debug lines
  bool statusLineShowsBody = false;  // the refused status's line carries the body's text
  platform::LogLevel emptyBodyLevel = platform::LogLevel::Error;
};

// checkAnswer logs the answer's arrival and returns nullopt when it arrived, with an accepted
// status and, where the rules require one, a body; otherwise it logs the fault and returns it.
std::optional<AnswerFault> checkAnswer(const Answer& answer, const AnswerRules& rules);

// parseAnswer parses `body` as strict JSON and logs the result; nullopt, after logging the
// parser's message, when it is not an object or an array.
std::optional<platform::Value> parseAnswer(const platform::Data& body);

}  // namespace answer_check

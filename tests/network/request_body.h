// What the operations' debug lines show of their requests and answers (tests log private data).
#pragma once

#include <nlohmann/json.hpp>
#include <optional>

#include "log_capture.h"

namespace nettest {

// The body of the first token request logged at or after `from` (the handshake's is skipped).
std::optional<nlohmann::json> uploadedBody(const LogCapture& log, size_t from = 0);

// How many answers to token requests were parsed (the handshake's answer is not counted).
int countParsedAnswers();

}  // namespace nettest

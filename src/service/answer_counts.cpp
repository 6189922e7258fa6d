#include "service/answer_counts.h"

#include "platform/bus/messaging.h"
#include "service/zlka_network_bus_interface.h"

AnswerCounts::AnswerCounts() {
  counts_.emplace("ok", 0);
  for (const char* name : {"Unknown", "MissingEntitlement", "InvalidParameter", "Internal", "Network", "Server"})
    counts_.emplace(std::string(kZLKAErrorPrefix) + name, 0);
  counts_.emplace(platform::kBusErrorInvalidArgs, 0);
}

void AnswerCounts::add(std::string_view errorName) {
  std::string_view key = errorName.empty() ? "ok" : errorName;
  std::lock_guard lock(mutex_);
  if (auto it = counts_.find(key); it != counts_.end())
    ++it->second;
  else
    counts_.emplace(std::string(key), 1);
}

std::map<std::string, uint64_t, std::less<>> AnswerCounts::counts() const {
  std::lock_guard lock(mutex_);
  return counts_;
}

AnswerCounts& answerCounts() {
  static AnswerCounts counts;
  return counts;
}

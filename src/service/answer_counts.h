// AnswerCounts: how the D-Bus face has answered its calls since start, by outcome: "ok" for an
// answer, else the D-Bus error name (com.kestro.ZLKAuthentication.Error.Network,
// org.freedesktop.DBus.Error.InvalidArgs, ...). Thread-safe; counting costs one short lock.
#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <string_view>

class AnswerCounts {
 public:
  // The outcomes every operator expects to see, listed with 0 from the start.
  AnswerCounts();

  // add counts one answer: `errorName` empty for success.
  void add(std::string_view errorName);
  // counts is a copy of the counts, keyed by outcome.
  std::map<std::string, uint64_t, std::less<>> counts() const;

 private:
  mutable std::mutex mutex_;
  std::map<std::string, uint64_t, std::less<>> counts_;
};

// answerCounts is the one set of counts of this process's D-Bus face (like its interface).
AnswerCounts& answerCounts();

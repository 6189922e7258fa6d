// Every line the process logs while the capture is installed, at debug level, in order. Tests
// read it to check fixed log lines and their order relative to replies.
#pragma once

#include <cstddef>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/log.h"

namespace nettest {

class LogCapture {
 public:
  // Takes over the log sink, lowers the log to debug level and shows private arguments.
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  void clear();
  // Number of entries so far: a mark that later searches can start from or stop at.
  size_t size() const;
  std::vector<platform::LogEntry> entries() const;

  // Entries whose message is exactly `message` at this level.
  int count(platform::LogLevel level, std::string_view message) const;
  int countStartingWith(std::string_view prefix) const;
  int countContaining(std::string_view part) const;
  // Index of the first entry in [from, to) with this level and exact message.
  std::optional<size_t> find(platform::LogLevel level, std::string_view message, size_t from = 0,
                             size_t to = static_cast<size_t>(-1)) const;
  std::optional<size_t> findStartingWith(std::string_view prefix, size_t from = 0) const;
  std::optional<size_t> findContaining(std::string_view part, size_t from = 0) const;

  // The captured lines, one per line, for failure messages.
  std::string dump() const;

 private:
  struct Store {
    mutable std::mutex mutex;
    std::vector<platform::LogEntry> entries;
  };
  std::shared_ptr<Store> store_ = std::make_shared<Store>();
  platform::LogSettings previous_;
};

}  // namespace nettest

// Every entry the process logs while a capture is installed, in order. The capture takes over the
// process's log sink (one at a time), lowers the log to debug level and shows private arguments,
// because tests read request bodies and fixed lines from the log.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/log/log.h"

namespace zlkatest {

class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  void clear();
  // The number of entries so far: a mark that later searches start from or stop at.
  size_t size() const;
  std::vector<platform::LogEntry> entries(size_t from = 0) const;  // from entry `from` on

  // How many entries in [from, to) have the message `text` at `level`; or, for the StartingWith
  // form, a message that starts with `prefix`, at `level` if one is given.
  int count(platform::LogLevel level, std::string_view text, size_t from = 0, size_t to = SIZE_MAX) const;
  int countStartingWith(std::string_view prefix, size_t from = 0,
                        std::optional<platform::LogLevel> level = std::nullopt) const;

  // "  [level] message" per line, for failure messages.
  std::string dump() const;

 private:
  struct Store {
    mutable std::mutex mutex;
    std::vector<platform::LogEntry> entries;
  };
  std::shared_ptr<Store> store_ = std::make_shared<Store>();
  platform::LogSettings previous_;
};

}  // namespace zlkatest

#include "common/log_capture.h"

#include <algorithm>
#include <cstdint>

namespace zlkatest {

using platform::LogEntry;

LogCapture::LogCapture() : previous_(platform::currentLogSettings()) {
  platform::LogSettings settings = previous_;
  settings.minimum = platform::LogLevel::Debug;
  settings.privateData = true;
  settings.backend = platform::LogBackend::Stderr;
  platform::configureLog(settings);
  platform::setLogSink([store = store_](const LogEntry& entry) {
    std::lock_guard lock(store->mutex);
    store->entries.push_back(entry);
  });
}

LogCapture::~LogCapture() {
  platform::setLogSink({});
  platform::configureLog(previous_);
}

void LogCapture::clear() {
  std::lock_guard lock(store_->mutex);
  store_->entries.clear();
}

size_t LogCapture::size() const {
  std::lock_guard lock(store_->mutex);
  return store_->entries.size();
}

std::vector<LogEntry> LogCapture::entries(size_t from) const {
  std::lock_guard lock(store_->mutex);
  const auto& all = store_->entries;
  return {all.begin() + static_cast<std::ptrdiff_t>(std::min(from, all.size())), all.end()};
}

int LogCapture::count(platform::LogLevel level, std::string_view text, size_t from, size_t to) const {
  const auto all = entries(from);
  return static_cast<int>(std::count_if(
      all.begin(), all.begin() + static_cast<std::ptrdiff_t>(std::min(all.size(), to - std::min(to, from))),
      [&](const LogEntry& e) { return e.level == level && e.message == text; }));
}

int LogCapture::countStartingWith(std::string_view prefix, size_t from, std::optional<platform::LogLevel> level) const {
  const auto all = entries(from);
  return static_cast<int>(std::count_if(all.begin(), all.end(), [&](const LogEntry& e) {
    return e.message.starts_with(prefix) && (!level || e.level == *level);
  }));
}

std::string LogCapture::dump() const {
  std::string out;
  for (const LogEntry& e : entries())
    out += "  [" + std::string(platform::logLevelName(e.level)) + "] " + e.message + "\n";
  return out;
}

}  // namespace zlkatest

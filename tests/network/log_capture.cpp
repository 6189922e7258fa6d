#include "log_capture.h"

namespace nettest {

LogCapture::LogCapture() : previous_(platform::currentLogSettings()) {
  platform::LogSettings settings = previous_;
  settings.minimum = platform::LogLevel::Debug;
  settings.privateData = true;  // request bodies and tokens are checked from their log lines
  settings.backend = platform::LogBackend::Stderr;
  platform::configureLog(settings);
  platform::setLogSink([store = store_](const platform::LogEntry& entry) {
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

std::vector<platform::LogEntry> LogCapture::entries() const {
  std::lock_guard lock(store_->mutex);
  return store_->entries;
}

int LogCapture::count(platform::LogLevel level, std::string_view message) const {
  int n = 0;
  for (const auto& e : entries())
    if (e.level == level && e.message == message) ++n;
  return n;
}

int LogCapture::countStartingWith(std::string_view prefix) const {
  int n = 0;
  for (const auto& e : entries())
    if (e.message.starts_with(prefix)) ++n;
  return n;
}

int LogCapture::countContaining(std::string_view part) const {
  int n = 0;
  for (const auto& e : entries())
    if (e.message.find(part) != std::string::npos) ++n;
  return n;
}

std::optional<size_t> LogCapture::find(platform::LogLevel level, std::string_view message, size_t from,
                                       size_t to) const {
  const auto all = entries();
  for (size_t i = from; i < all.size() && i < to; ++i)
    if (all[i].level == level && all[i].message == message) return i;
  return std::nullopt;
}

std::optional<size_t> LogCapture::findStartingWith(std::string_view prefix, size_t from) const {
  const auto all = entries();
  for (size_t i = from; i < all.size(); ++i)
    if (all[i].message.starts_with(prefix)) return i;
  return std::nullopt;
}

std::optional<size_t> LogCapture::findContaining(std::string_view part, size_t from) const {
  const auto all = entries();
  for (size_t i = from; i < all.size(); ++i)
    if (all[i].message.find(part) != std::string::npos) return i;
  return std::nullopt;
}

std::string LogCapture::dump() const {
  std::string out;
  for (const auto& e : entries()) {
    out += "  [";
    out += platform::logLevelName(e.level);
    out += "] ";
    out += e.message;
    out += "\n";
  }
  return out;
}

}  // namespace nettest

#include "common/log_capture.h"

#include <algorithm>

namespace zlkatest {

namespace {

using platform::LogEntry;

constexpr size_t kEnd = static_cast<size_t>(-1);

// Indices in [from, to) of the entries that `match` accepts.
template <class Match>
std::vector<size_t> matching(const std::vector<LogEntry>& all, size_t from, size_t to, Match match) {
  std::vector<size_t> out;
  for (size_t i = from; i < all.size() && i < to; ++i)
    if (match(all[i])) out.push_back(i);
  return out;
}

}  // namespace

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

std::optional<size_t> LogCapture::find(platform::LogLevel level, std::string_view text, size_t from, size_t to) const {
  auto found = matching(entries(), from, to, [&](const LogEntry& e) { return e.level == level && e.message == text; });
  return found.empty() ? std::nullopt : std::optional(found.front());
}

std::optional<size_t> LogCapture::findStartingWith(std::string_view prefix, size_t from) const {
  auto found = matching(entries(), from, kEnd, [&](const LogEntry& e) { return e.message.starts_with(prefix); });
  return found.empty() ? std::nullopt : std::optional(found.front());
}

int LogCapture::count(platform::LogLevel level, std::string_view text, size_t from) const {
  return matching(entries(), from, kEnd, [&](const LogEntry& e) { return e.level == level && e.message == text; }).size();
}

int LogCapture::countStartingWith(std::string_view prefix, size_t from) const {
  return matching(entries(), from, kEnd, [&](const LogEntry& e) { return e.message.starts_with(prefix); }).size();
}

std::string LogCapture::dump() const {
  std::string out;
  for (const LogEntry& e : entries()) out += "  [" + std::string(platform::logLevelName(e.level)) + "] " + e.message + "\n";
  return out;
}

}  // namespace zlkatest

// Settings store: a named suite of developer settings kept as one JSON object in
// <directory>/<suite>.json. The file is read at every lookup (parsed again only when it changed),
// so edits act at once; writes replace it atomically. A missing, unreadable or unparsable file
// reads as empty; an unparsable one is logged once per change.
#pragma once

#include <sys/stat.h>

#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/values/value.h"

namespace platform {

class SettingsStore {
 public:
  // SettingsStore reads and writes <directory>/<suiteName>.json; nothing is touched until used.
  SettingsStore(std::string suiteName, std::filesystem::path directory);
  // openSuite makes the store of `suiteName` in the directory of the current configuration
  // ([settings] suite_dir).
  static std::shared_ptr<SettingsStore> openSuite(std::string suiteName);

  // The suite's name and its file, borrowed from the store.
  const std::string& suiteName() const { return suite_; }
  const std::filesystem::path& filePath() const { return path_; }

  // objectForKey is the value under `key` in the file as it is now, or nullopt when there is none.
  std::optional<Value> objectForKey(std::string_view key);
  // boolForKey is true for true, a non-zero number, or "YES", "true" or "1" in any letter case.
  bool boolForKey(std::string_view key);
  // stringForKey is the string under `key`; anything else, or nothing, is nullopt.
  std::optional<std::string> stringForKey(std::string_view key);
  // dictionaryRepresentation is every setting in the file as it is now (empty when unreadable).
  Dictionary dictionaryRepresentation();

  // setObject stores `value` under `key` and removeObject removes the key (absent is success).
  // Both read, modify and replace the file under a lock file, so that concurrent writers lose
  // nothing, creating the directory if needed; they return false when the value cannot be written
  // as JSON or the file cannot be locked or written, leaving the file as it was.
  bool setObject(std::string_view key, const Value& value);
  bool removeObject(std::string_view key);

 private:
  Dictionary load();
  bool modify(const std::function<void(Dictionary&)>& change);

  std::string suite_;
  std::filesystem::path path_;
  std::mutex mutex_;
  struct Stamp {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = -1;
    struct timespec modified {};
    bool operator==(const Stamp& o) const {
      return device == o.device && inode == o.inode && size == o.size && modified.tv_sec == o.modified.tv_sec &&
             modified.tv_nsec == o.modified.tv_nsec;
    }
  };
  std::optional<Stamp> stamp_;
  Dictionary cached_;
};

}  // namespace platform

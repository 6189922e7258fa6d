#include "support/json_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>
#include <sstream>

#include "platform/json.h"

std::optional<platform::Value> readJSONFile(const std::optional<std::filesystem::path>& path) {
  if (!path) return std::nullopt;
  std::ifstream in(*path, std::ios::binary);
  if (!in) return std::nullopt;
  std::stringstream buffer;
  buffer << in.rdbuf();
  if (in.bad()) return std::nullopt;
  return platform::json::parse(buffer.str());
}

bool writeJSONFile(const std::optional<platform::Value>& object, const std::optional<std::filesystem::path>& path) {
  if (!path) return false;
  std::optional<std::string> text = platform::json::serialize(object ? *object : platform::Value(platform::Dictionary{}), true);
  if (!text) return false;
  std::string tmp = path->string() + ".XXXXXX";
  int fd = mkostemp(tmp.data(), O_CLOEXEC);
  if (fd < 0) return false;
  bool ok = true;
  const char* p = text->data();
  size_t left = text->size();
  while (ok && left > 0) {
    ssize_t w = ::write(fd, p, left);
    if (w < 0 && errno == EINTR) continue;
    ok = w > 0;
    if (ok) {
      p += w;
      left -= static_cast<size_t>(w);
    }
  }
  ok = ok && fchmod(fd, 0644) == 0 && fsync(fd) == 0;
  ok = (::close(fd) == 0) && ok;
  if (ok) ok = ::rename(tmp.c_str(), path->c_str()) == 0;
  if (!ok) ::unlink(tmp.c_str());
  return ok;
}

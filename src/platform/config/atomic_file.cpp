#include "platform/config/atomic_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "platform/values/unique_fd.h"

namespace platform {

bool writeFileAtomically(const std::filesystem::path& path, std::string_view contents, mode_t mode) {
  std::string tmp = path.string() + ".XXXXXX";
  UniqueFd fd(mkostemp(tmp.data(), O_CLOEXEC));
  if (!fd) return false;
  bool ok = true;
  const char* p = contents.data();
  size_t left = contents.size();
  while (ok && left > 0) {
    ssize_t w = ::write(fd.get(), p, left);
    if (w < 0 && errno == EINTR) continue;
    ok = w > 0;
    if (ok) {
      p += w;
      left -= static_cast<size_t>(w);
    }
  }
  ok = ok && fchmod(fd.get(), mode) == 0 && fsync(fd.get()) == 0;
  // The close is checked: on some file systems it is where a failed write shows.
  ok = (::close(fd.release()) == 0) && ok;
  if (ok) ok = ::rename(tmp.c_str(), path.c_str()) == 0;
  if (!ok) ::unlink(tmp.c_str());
  return ok;
}

}  // namespace platform

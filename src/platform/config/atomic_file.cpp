#include "platform/config/atomic_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>

#include "platform/values/unique_fd.h"

namespace platform {

Done writeFileAtomically(const std::filesystem::path& path, std::string_view contents, mode_t mode) {
  std::string tmp = path.string() + ".XXXXXX";
  UniqueFd fd(mkostemp(tmp.data(), O_CLOEXEC));
  if (!fd) return Failure{std::string("cannot be created: ") + std::strerror(errno)};
  int error = fchmod(fd.get(), mode) == 0 ? 0 : errno;
  for (size_t done = 0; error == 0 && done < contents.size();) {
    ssize_t n = ::write(fd.get(), contents.data() + done, contents.size() - done);
    if (n > 0)
      done += static_cast<size_t>(n);
    else if (n == 0 || errno != EINTR)
      error = n == 0 ? EIO : errno;
  }
  if (error == 0 && fsync(fd.get()) != 0) error = errno;
  // The close is checked: on some file systems it is where a failed write shows.
  if (::close(fd.release()) != 0 && error == 0) error = errno;
  if (error == 0 && ::rename(tmp.c_str(), path.c_str()) != 0) error = errno;
  if (error == 0) return std::nullopt;
  ::unlink(tmp.c_str());
  return Failure{std::string("cannot be written: ") + std::strerror(error)};
}

}  // namespace platform

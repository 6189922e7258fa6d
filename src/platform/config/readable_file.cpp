#include "platform/config/readable_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/values/unique_fd.h"

namespace platform {

namespace {

std::optional<std::string> reason(const std::filesystem::path& path, bool directory) {
  // O_NONBLOCK: a FIFO named by mistake must not hang start-up.
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | (directory ? O_DIRECTORY : 0)));
  if (!fd) {
    int e = errno;
    if (e == ENOENT) return "does not exist";
    if (e == EACCES || e == EPERM) return "permission denied";
    if (e == ENOTDIR) return directory ? "is not a directory" : "does not exist";
    return std::string(std::strerror(e));
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return std::string(std::strerror(errno));
  if (!directory && !S_ISREG(st.st_mode)) return "is not a regular file";
  return std::nullopt;
}

}  // namespace

std::optional<std::string> unreadableFileReason(const std::filesystem::path& path) { return reason(path, false); }

std::optional<std::string> unreadableDirectoryReason(const std::filesystem::path& path) { return reason(path, true); }

}  // namespace platform

#include "devserver/state_files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <sstream>
#include <system_error>

namespace devserver {

namespace fs = std::filesystem;

platform::Failure fileError(const fs::path& path, const std::string& what) {
  return platform::Failure{path.string() + ": " + what};
}

platform::Result<std::optional<std::string>> readFile(const fs::path& path) {
  std::error_code error;
  if (!fs::exists(path, error)) {
    if (error) {
      return fileError(path, error.message());
    }
    return std::optional<std::string>();
  }
  std::ifstream in(path, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  if (!in) {
    return fileError(path, "cannot be read");
  }
  return std::optional<std::string>(std::move(text).str());
}

platform::Done writeFileAtomically(const fs::path& path, std::string_view content, mode_t mode) {
  std::string temporary = path.string() + ".XXXXXX";
  const int fd = mkstemp(temporary.data());
  if (fd < 0) {
    return fileError(path, std::string("cannot be created: ") + std::strerror(errno));
  }
  int error = fchmod(fd, mode) == 0 ? 0 : errno;
  for (std::size_t done = 0; error == 0 && done < content.size();) {
    const ssize_t n = ::write(fd, content.data() + done, content.size() - done);
    if (n > 0) {
      done += static_cast<std::size_t>(n);
    } else if (n == 0 || errno != EINTR) {
      error = n == 0 ? EIO : errno;
    }
  }
  if (error == 0 && fsync(fd) != 0) {
    error = errno;
  }
  if (::close(fd) != 0 && error == 0) {
    error = errno;
  }
  if (error == 0 && std::rename(temporary.c_str(), path.c_str()) != 0) {
    error = errno;
  }
  if (error != 0) {
    std::remove(temporary.c_str());
    return fileError(path, std::string("cannot be written: ") + std::strerror(error));
  }
  return std::nullopt;
}

}  // namespace devserver

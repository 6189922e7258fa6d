#include "devserver/state_files.h"

#include <fstream>
#include <sstream>
#include <system_error>

#include "platform/config/atomic_file.h"

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

platform::Done writeStateFile(const fs::path& path, std::string_view content, mode_t mode) {
  if (platform::Done failed = platform::writeFileAtomically(path, content, mode)) {
    return fileError(path, failed->message);
  }
  return std::nullopt;
}

}  // namespace devserver

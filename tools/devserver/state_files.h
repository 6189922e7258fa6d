// Reading and atomically writing the files of the server's state directory; every failure
// names the file and says what went wrong with it.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

#include "platform/values/result.h"

namespace devserver {

// fileError is the failure "<path>: <what>".
platform::Failure fileError(const std::filesystem::path& path, const std::string& what);

// readFile returns the content of `path`, nullopt when it does not exist, or a failure when it
// cannot be read.
platform::Result<std::optional<std::string>> readFile(const std::filesystem::path& path);

// writeStateFile replaces `path` with `content`, readable as `mode`, so that a reader sees the old
// file or the new one, never half of one; nullopt on success, else why it failed, naming the file
// (and nothing is left behind).
platform::Done writeStateFile(const std::filesystem::path& path, std::string_view content, mode_t mode);

}  // namespace devserver

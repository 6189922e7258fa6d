// Atomic replacement of a file's contents: the bytes go to a temporary file in the same directory,
// are flushed to disk, and the temporary is renamed over the target, so readers see the old or the
// new contents, never a mix.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <string_view>

#include "platform/values/result.h"

namespace platform {

// writeFileAtomically replaces the file at `path` with `contents`, with permissions `mode`. When a
// step fails it leaves the old file and no temporary behind and says why ("cannot be written: <errno
// text>"), to follow the file's name.
Done writeFileAtomically(const std::filesystem::path& path, std::string_view contents, mode_t mode = 0644);

}  // namespace platform

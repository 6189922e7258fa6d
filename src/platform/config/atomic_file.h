// Atomic replacement of a file's contents: the bytes go to a temporary file in the same directory,
// are flushed to disk, and the temporary is renamed over the target, so readers see the old or the
// new contents, never a mix.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <string_view>

namespace platform {

// writeFileAtomically replaces the file at `path` with `contents`, with permissions `mode`. It
// returns false, leaving the old file and no temporary behind, when any step fails.
bool writeFileAtomically(const std::filesystem::path& path, std::string_view contents, mode_t mode = 0644);

}  // namespace platform

// Why a file or directory named by the configuration cannot be used, in the words an operator
// looks for: "does not exist", "permission denied", "is not a regular file", "is not a directory".
#pragma once

#include <filesystem>
#include <optional>
#include <string>

namespace platform {

// unreadableFileReason is nullopt when `path` names a regular file this process can open for
// reading, else the reason it cannot. It opens and closes the file; nothing else is kept.
std::optional<std::string> unreadableFileReason(const std::filesystem::path& path);

// unreadableDirectoryReason is the same for a directory this process can list.
std::optional<std::string> unreadableDirectoryReason(const std::filesystem::path& path);

}  // namespace platform

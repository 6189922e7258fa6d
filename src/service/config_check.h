// What start-up checks of a configuration beyond its syntax (which loadConfiguration checks): the
// files and directories it names must be usable, so that a mistake stops the daemon at start
// rather than failing every call later. `zlkad --check-config` runs the same checks.
#pragma once

#include <filesystem>
#include <string>
#include <vector>

#include "platform/config/configuration.h"

// startUpProblems lists what makes `config` unusable, each as "<file>: <key>: <path>: <reason>"
// (reasons such as "does not exist" or "permission denied"); empty when nothing does. It reads
// sap.trust_anchor and hands it to the secure-association primitives (which keep it: start-up
// needs exactly that), checks that tls.ca_file, when given, is a readable PEM bundle, and that
// entitlements.dir is a directory it can list.
std::vector<std::string> startUpProblems(const platform::Configuration& config);

// manifestFileCount is the number of *.json files in the entitlement directory (0 when it cannot
// be listed), to compare with the entries that loaded.
size_t manifestFileCount(const std::filesystem::path& directory);

// Start-up of zlkad before the listener runs: the command line, the configuration file, the log,
// device facts, the secure-association trust anchor and the entitlement manifests.
#pragma once

#include <optional>

// nullopt: everything is in place, run the listener. Otherwise the exit status (0 for --help and
// --version, 1 for a configuration problem, 2 for a command-line mistake).
std::optional<int> setUpDaemon(int argc, char** argv);

// Start-up of zlkad before the listener runs: the command line, the log, the configuration file
// and the files it names, device facts, the secure-association trust anchor, the entitlement
// manifests, and the runtime control that the listener's loop will serve.
#pragma once

#include <chrono>
#include <optional>

// Exit statuses. A configuration that cannot be used ends the unit for good: the unit names this
// status in RestartPreventExitStatus=, so systemd does not restart into the same mistake (78 is
// EX_CONFIG of sysexits.h). A bus that cannot be used exits 1, which is worth a restart.
inline constexpr int kExitUsage = 2;
inline constexpr int kExitConfiguration = 78;

// The longest wait for calls in flight at shutdown. Shorter than the unit's TimeoutStopSec (90 s),
// so that calls still running are answered with an error before systemd kills the process.
inline constexpr std::chrono::seconds kDrainLimit{60};

// setUpDaemon returns nullopt when everything is in place and the listener should run, else the
// exit status: 0 after --help, --version or a --check-config that passed, kExitUsage for a
// command-line mistake, kExitConfiguration for a configuration that cannot be used.
std::optional<int> setUpDaemon(int argc, char** argv);

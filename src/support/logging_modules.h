// Logging convention and the module facility.
//
// Every line goes to the default log object through platform::log. Lines of the token client start
// with "[#TokenAuth] ", lines of the secure-association session with "[#TarvexSAPSession] ". Token
// bytes, UUIDs, bodies and dictionaries are logged only as "%{private}@"; pointers go through
// obfuscatedPointer before "%p". Operation entries log at default level, progress at info or debug,
// causes of failure at error, and the error returned to a client at fault ("[#TokenAuth] error: %@").
//
// The module facility turns a table of (subsystem, category) rows into log objects, once per
// process; the service registers no table of its own.
#pragma once

#include <cstdint>
#include <memory>

#include "platform/log.h"

struct LoggingModuleEntry_t {
  const char* subsystem;  // may be null
  const char* category;   // may be null
};

using LoggingModuleLog = std::shared_ptr<const platform::Log>;

// Creates one log object per row into out[0..count-1] (a slot stays null when creation fails) and
// publishes (out, count). Runs once per process; later calls do nothing.
void loggingModules_setup(const LoggingModuleEntry_t* table, uint8_t count, LoggingModuleLog* out);

// The published module array and count; null and 0 before set-up.
const LoggingModuleLog* loggingModules_logs();
uint8_t loggingModules_count();

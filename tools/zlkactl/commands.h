// Running a parsed zlkactl invocation: answers go to `out`, failures to `err` (one line, JSON with
// --json, see output_format.h), and the result is the process's exit status (command_line.h).
#pragma once

#include <ostream>

#include "zlka/client.h"
#include "zlkactl/command_line.h"

namespace zlkactl {

int run(const Invocation& invocation, std::ostream& out, std::ostream& err);

// metadata, activate, confirm: one call to the daemon.
int runOperation(const Invocation& invocation, std::ostream& out, std::ostream& err);
// defaults read, write, delete: the settings suite named in the configuration file.
int runDefaults(const Invocation& invocation, std::ostream& out, std::ostream& err);

// exitStatusFor returns the exit status for a failed call: unreachable service, refused input, or
// failed operation.
int exitStatusFor(const zlka::Error& error);

// fail prints zlkactl's own error (`exitStatus` and `description`) as the invocation asks and
// returns `exitStatus`.
int fail(const Invocation& invocation, std::ostream& err, int exitStatus, std::string description);

}  // namespace zlkactl

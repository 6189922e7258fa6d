// Running a parsed zlkactl invocation: answers go to `out`, failures to `err` (one line, see
// output_format.h), and the result is the process's exit status (command_line.h, ExitStatus).
#pragma once

#include <ostream>

#include "platform/error.h"
#include "zlkactl/command_line.h"

namespace zlkactl {

int run(const Invocation& invocation, std::ostream& out, std::ostream& err);

// metadata, activate, confirm: one call to the daemon.
int runOperation(const Invocation& invocation, std::ostream& out, std::ostream& err);
// defaults read, write, delete: the settings suite named in the configuration file.
int runDefaults(const Invocation& invocation, std::ostream& out, std::ostream& err);

// The exit status for a failed call: unreachable service, refused input, or failed operation.
int exitStatusFor(const platform::Error& error);

}  // namespace zlkactl

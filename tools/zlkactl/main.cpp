// zlkactl: the command-line client of zlkad (see command_line.h for its usage).
#include <iostream>

#include "platform/log/log.h"
#include "zlkactl/command_line.h"
#include "zlkactl/commands.h"

int main(int argc, char** argv) {
  // Library log lines (an unreadable settings file, say) go to the terminal, not the journal.
  platform::configureLog(
      {.minimum = platform::LogLevel::Default, .backend = platform::LogBackend::Stderr, .identifier = "zlkactl"});
  zlkactl::ParsedCommandLine parsed = zlkactl::parseCommandLine(argc, argv, std::cout, std::cerr);
  if (!parsed.invocation) return parsed.exitStatus;
  return zlkactl::run(*parsed.invocation, std::cout, std::cerr);
}

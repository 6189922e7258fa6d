#include "common/private_bus.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <vector>

extern char** environ;

namespace client_test {

PrivateBus::PrivateBus(bool anyUser) {
  char pattern[] = "/tmp/zlka-client-bus-XXXXXX";
  if (!::mkdtemp(pattern)) {
    ADD_FAILURE() << "mkdtemp failed";
    return;
  }
  directory_ = pattern;
  if (anyUser) std::filesystem::permissions(directory_, std::filesystem::perms(0755));
  std::filesystem::path config = directory_ / "bus.conf";
  std::ofstream(config)
      << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
         " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
         "<busconfig><type>session</type><auth>EXTERNAL</auth><listen>unix:path="
      << (directory_ / "socket").string()
      << "</listen>\n"
         // Room for the benchmark's thousand idle peers.
         "<limit name=\"max_completed_connections\">4096</limit><limit name=\"max_connections_per_user\">4096</limit>\n"
         "<policy context=\"default\">"
      << (anyUser ? "<allow user=\"*\"/>" : "")
      << "<allow send_destination=\"*\" eavesdrop=\"true\"/><allow eavesdrop=\"true\"/><allow own=\"*\"/></policy>\n"
         "</busconfig>\n";

  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) {
    ADD_FAILURE() << "pipe2 failed";
    return;
  }
  // The daemon writes its address on descriptor 3 of its own.
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, fds[1], 3);
  // Its complaints (it cannot raise its descriptor limit without privileges) go to a log file.
  std::string log = (directory_ / "bus.log").string();
  posix_spawn_file_actions_addopen(&actions, 2, log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  std::string configArgument = "--config-file=" + config.string();
  std::vector<char*> argv = {const_cast<char*>("dbus-daemon"), configArgument.data(), const_cast<char*>("--nofork"),
                             const_cast<char*>("--print-address=3"), nullptr};
  int rc = posix_spawnp(&pid_, "dbus-daemon", &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  ::close(fds[1]);
  if (rc != 0) {
    pid_ = -1;
    ::close(fds[0]);
    ADD_FAILURE() << "cannot start dbus-daemon: " << std::strerror(rc);
    return;
  }
  // Read up to the line feed; end of file (the daemon exited) ends the loop as well.
  std::string line;
  char c;
  while (::read(fds[0], &c, 1) == 1 && c != '\n') line.push_back(c);
  ::close(fds[0]);
  std::ostringstream complaints;
  complaints << std::ifstream(log).rdbuf();
  if (line.empty()) ADD_FAILURE() << "dbus-daemon printed no address: " << complaints.str();
  address_ = line;
}

PrivateBus::~PrivateBus() {
  if (pid_ > 0) {
    ::kill(pid_, SIGTERM);
    int status = 0;
    ::waitpid(pid_, &status, 0);
  }
  std::error_code ec;
  if (!directory_.empty()) std::filesystem::remove_all(directory_, ec);
}

}  // namespace client_test

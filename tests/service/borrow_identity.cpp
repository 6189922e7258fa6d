// borrow_identity BUS_ADDRESS PROGRAM [ARGUMENTS...]
//
// The fork-then-exec attempt to borrow another program's identity: connect to the bus, fork, let
// the connecting process exec PROGRAM (so that the pid the bus recorded now shows PROGRAM), and
// send ConfirmActivationForToken with no arguments from the child on the inherited connection.
// Prints the D-Bus error name of the answer ("timeout" when none came) and ends the exec'd parent.
// sd-bus refuses to work in a forked child, so the child writes a call marshalled by hand.
#include <poll.h>
#include <signal.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string>

namespace {

// A little-endian method call whose body is an empty a{sv}.
std::string confirmCall() {
  // METHOD_CALL, protocol 1, a body of 8 bytes, serial 1000; the header fields' length comes last.
  std::string m("l\1\0\1\10\0\0\0\350\3\0\0\0\0\0\0", 16);
  auto field = [&m](char code, char type, std::string_view value) {
    m.resize((m.size() + 7) / 8 * 8, '\0');
    m += {code, 1, type, '\0'};
    const uint32_t length = static_cast<uint32_t>(value.size());
    if (type == 'g')
      m += static_cast<char>(length);
    else
      m.append(reinterpret_cast<const char*>(&length), 4);
    (m += value) += '\0';
  };
  field(1, 'o', "/com/kestro/ZLKAuthentication/ZLKANetwork");
  field(2, 's', "com.kestro.ZLKAuthentication.ZLKANetworkProtocol");
  field(3, 's', "ConfirmActivationForToken");
  field(6, 's', "com.kestro.ZLKAuthentication.ZLKANetwork");
  field(8, 'g', "a{sv}");
  const uint32_t fields = static_cast<uint32_t>(m.size() - 16);
  std::memcpy(&m[12], &fields, 4);
  m.resize((m.size() + 7) / 8 * 8, '\0');
  return m + std::string(8, '\0');  // the array's length, and the padding to where its entries start
}

// The first D-Bus error name in what the connection receives within 30 seconds.
std::string answerName(int fd) {
  std::string received;
  for (auto end = std::chrono::steady_clock::now() + std::chrono::seconds(30);
       std::chrono::steady_clock::now() < end;) {
    for (std::string_view prefix : {"com.kestro.ZLKAuthentication.Error.", "org.freedesktop.DBus.Error."})
      if (size_t at = received.find(prefix), stop = received.find('\0', at);
          at != std::string::npos && stop != std::string::npos)
        return received.substr(at, stop - at);
    pollfd p{fd, POLLIN, 0};
    if (::poll(&p, 1, 100) <= 0) continue;
    char buffer[4096];
    ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n <= 0) break;
    received.append(buffer, static_cast<size_t>(n));
  }
  return "timeout";
}

}  // namespace

int main(int argc, char** argv) {
  sd_bus* bus = nullptr;
  const char* unique = nullptr;  // asking for it waits until the connection is fully set up
  if (argc < 3 || sd_bus_new(&bus) < 0 || sd_bus_set_address(bus, argv[1]) < 0 || sd_bus_set_bus_client(bus, 1) < 0 ||
      sd_bus_start(bus) < 0 || sd_bus_get_unique_name(bus, &unique) < 0) {
    std::fprintf(stderr, "usage: borrow_identity BUS_ADDRESS PROGRAM [ARGUMENTS...] (and a bus that can be reached)\n");
    return 2;
  }
  const int fd = sd_bus_get_fd(bus);
  const std::string call = confirmCall(), program = std::filesystem::canonical(argv[2]).string();
  const pid_t connecting = getpid();
  const pid_t child = fork();
  if (child < 0) return 1;
  if (child > 0) {
    execv(argv[2], argv + 2);
    _exit(127);
  }
  // Wait until the connecting process runs PROGRAM, so the daemon can only ever see PROGRAM there.
  const std::string exe = "/proc/" + std::to_string(connecting) + "/exe";
  std::error_code ec;
  for (int i = 0; i < 1000 && std::filesystem::read_symlink(exe, ec) != program; ++i) usleep(10'000);
  std::printf("%s\n", ::write(fd, call.data(), call.size()) == static_cast<ssize_t>(call.size())
                          ? answerName(fd).c_str()
                          : "write failed");
  std::fflush(stdout);
  ::kill(connecting, SIGKILL);
  _exit(0);
}

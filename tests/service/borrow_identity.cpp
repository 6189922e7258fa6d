// borrow_identity BUS_ADDRESS PROGRAM [ARGUMENTS...]
//
// The fork-then-exec attempt to borrow another program's identity: connect to the bus, fork, let
// the connecting process exec PROGRAM (so that the pid the bus recorded now shows PROGRAM), and
// send ConfirmActivationForToken with no arguments from the child on the inherited connection.
// Prints the D-Bus error name of the answer ("timeout" when none came) and ends the exec'd parent.
//
// sd-bus refuses to work in a forked child, so the child writes a call marshalled by hand.
#include <poll.h>
#include <signal.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

namespace {

class Marshal {
 public:
  std::vector<uint8_t> bytes;
  void align(size_t n) {
    while (bytes.size() % n) bytes.push_back(0);
  }
  void u8(uint8_t v) { bytes.push_back(v); }
  void u32(uint32_t v) {
    align(4);
    for (int i = 0; i < 4; ++i) bytes.push_back(static_cast<uint8_t>(v >> (8 * i)));
  }
  void putU32(size_t at, uint32_t v) {
    for (int i = 0; i < 4; ++i) bytes[at + i] = static_cast<uint8_t>(v >> (8 * i));
  }
  void text(std::string_view s) {  // 's' and 'o'
    u32(static_cast<uint32_t>(s.size()));
    bytes.insert(bytes.end(), s.begin(), s.end());
    bytes.push_back(0);
  }
  void signature(std::string_view s) {  // 'g'
    u8(static_cast<uint8_t>(s.size()));
    bytes.insert(bytes.end(), s.begin(), s.end());
    bytes.push_back(0);
  }
  void headerField(uint8_t code, char type, std::string_view value) {
    align(8);
    u8(code);
    signature(std::string_view(&type, 1));
    if (type == 'g') signature(value);
    else text(value);
  }
};

// A little-endian method call whose body is an empty a{sv}.
std::vector<uint8_t> confirmCall(uint32_t serial) {
  Marshal m;
  m.u8('l'), m.u8(1), m.u8(0), m.u8(1);  // endianness, METHOD_CALL, no flags, protocol 1
  m.u32(8);                              // body: the array length and the padding to its first entry
  m.u32(serial);
  size_t lengthAt = m.bytes.size();
  m.u32(0);
  size_t fieldsStart = m.bytes.size();
  m.headerField(1, 'o', "/com/kestro/ZLKAuthentication/ZLKANetwork");
  m.headerField(2, 's', "com.kestro.ZLKAuthentication.ZLKANetworkProtocol");
  m.headerField(3, 's', "ConfirmActivationForToken");
  m.headerField(6, 's', "com.kestro.ZLKAuthentication.ZLKANetwork");
  m.headerField(8, 'g', "a{sv}");
  m.putU32(lengthAt, static_cast<uint32_t>(m.bytes.size() - fieldsStart));
  m.align(8);
  m.u32(0);
  m.align(8);
  return m.bytes;
}

// The first D-Bus error name in what the connection receives within the deadline.
std::string answerName(int fd, std::chrono::seconds deadline) {
  std::string received;
  auto end = std::chrono::steady_clock::now() + deadline;
  while (std::chrono::steady_clock::now() < end) {
    for (std::string_view prefix : {"com.kestro.ZLKAuthentication.Error.", "org.freedesktop.DBus.Error."}) {
      size_t at = received.find(prefix);
      size_t stop = at == std::string::npos ? at : received.find('\0', at);
      if (stop != std::string::npos) return received.substr(at, stop - at);
    }
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
  if (argc < 3) {
    std::fprintf(stderr, "usage: borrow_identity BUS_ADDRESS PROGRAM [ARGUMENTS...]\n");
    return 2;
  }
  sd_bus* bus = nullptr;
  const char* unique = nullptr;
  if (sd_bus_new(&bus) < 0 || sd_bus_set_address(bus, argv[1]) < 0 || sd_bus_set_bus_client(bus, 1) < 0 ||
      sd_bus_start(bus) < 0 || sd_bus_get_unique_name(bus, &unique) < 0) {
    std::fprintf(stderr, "borrow_identity: cannot connect to %s\n", argv[1]);
    return 1;
  }
  int fd = sd_bus_get_fd(bus);
  std::vector<uint8_t> call = confirmCall(1000);
  std::string program = std::filesystem::canonical(argv[2]).string();
  pid_t connecting = getpid();
  pid_t child = fork();
  if (child < 0) return 1;
  if (child > 0) {
    execv(argv[2], argv + 2);
    _exit(127);
  }
  // Wait until the connecting process runs PROGRAM, so the daemon can only ever see PROGRAM there.
  std::string exe = "/proc/" + std::to_string(connecting) + "/exe";
  for (int i = 0; i < 1000; ++i) {
    std::error_code ec;
    if (std::filesystem::read_symlink(exe, ec) == program) break;
    usleep(10'000);
  }
  std::string name = ::write(fd, call.data(), call.size()) == static_cast<ssize_t>(call.size())
                         ? answerName(fd, std::chrono::seconds(30))
                         : "write failed";
  std::printf("%s\n", name.c_str());
  std::fflush(stdout);
  ::kill(connecting, SIGKILL);
  _exit(0);
}

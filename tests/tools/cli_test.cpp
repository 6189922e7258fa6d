// The command line: --listen parsing, and the program itself as a user runs it (start line,
// real port, request log, clean exit on SIGTERM, refusal of a bad catalogue, --help).
#include <fcntl.h>
#include <gtest/gtest.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <regex>

#include "devserver/listen_address.h"
#include "devserver_test_support.h"

extern char** environ;

namespace devtest {
namespace {

namespace fs = std::filesystem;
using devserver::parseListenAddress;
using devserver::urlHost;

TEST(ListenAddress, ParsesHostAndPort) {
  const auto v4 = parseListenAddress("127.0.0.1:8443");
  ASSERT_TRUE(v4);
  EXPECT_EQ(v4->host, "127.0.0.1");
  EXPECT_EQ(v4->port, 8443);
  const auto v6 = parseListenAddress("[::1]:0");
  ASSERT_TRUE(v6);
  EXPECT_EQ(v6->host, "::1");
  EXPECT_EQ(v6->port, 0);
  EXPECT_EQ(parseListenAddress("localhost:65535")->port, 65535);
  for (const char* bad : {"", "127.0.0.1", "127.0.0.1:", ":80", "127.0.0.1:65536", "127.0.0.1:-1", "127.0.0.1:8x",
                          "::1:80", "[]:80", "127.0.0.1:123456"}) {
    EXPECT_FALSE(parseListenAddress(bad)) << bad;
  }
  EXPECT_EQ(urlHost("127.0.0.1"), "127.0.0.1");
  EXPECT_EQ(urlHost("0.0.0.0"), "127.0.0.1");
  EXPECT_EQ(urlHost("::1"), "[::1]");
  EXPECT_EQ(urlHost("::"), "[::1]");
  EXPECT_EQ(urlHost("localhost"), "localhost");
}

TEST(DevServerStart, ABusyPortOrASecondStartIsReported) {
  TestServer first;
  TempDir dir;
  devserver::DevServerOptions options;
  options.stateDir = dir.path() / "state";
  options.port = first.server().port();
  devserver::DevServer second(options);
  const auto error = second.start();
  ASSERT_TRUE(error);
  EXPECT_NE(error->find("cannot listen on 127.0.0.1:" + std::to_string(options.port)), std::string::npos) << *error;

  const auto again = first.server().start();
  ASSERT_TRUE(again);
  // The refused second start left the first one serving.
  const auto answer = first.client()->Get("/deviceservices/setup.crt");
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->status, 200);
}

struct Child {
  pid_t pid = -1;
  int stdoutFd = -1;
};

// Runs the program with stdout on a pipe and stderr in `stderrFile`.
Child spawn(const std::vector<std::string>& args, const fs::path& stderrFile) {
  int fds[2];
  EXPECT_EQ(pipe2(fds, O_CLOEXEC), 0);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, fds[1], STDOUT_FILENO);
  posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, stderrFile.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  std::vector<std::string> argvStrings = {ZLKA_DEVSERVER_BINARY};
  argvStrings.insert(argvStrings.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (std::string& arg : argvStrings) {
    argv.push_back(arg.data());
  }
  argv.push_back(nullptr);
  Child child;
  EXPECT_EQ(posix_spawn(&child.pid, ZLKA_DEVSERVER_BINARY, &actions, nullptr, argv.data(), environ), 0);
  posix_spawn_file_actions_destroy(&actions);
  close(fds[1]);
  child.stdoutFd = fds[0];
  return child;
}

// Everything up to the first newline, or to end of file.
std::string readLine(int fd) {
  std::string line;
  char c = 0;
  while (line.size() < 4096 && read(fd, &c, 1) == 1 && c != '\n') {
    line += c;
  }
  return line;
}

std::string readAll(int fd) {
  std::string text;
  char buffer[4096];
  ssize_t n = 0;
  while ((n = read(fd, buffer, sizeof buffer)) > 0) {
    text.append(buffer, static_cast<std::size_t>(n));
  }
  return text;
}

// The exit status, or 128 + the signal that ended it.
int waitFor(Child& child) {
  int status = 0;
  EXPECT_EQ(waitpid(child.pid, &status, 0), child.pid);
  close(child.stdoutFd);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

TEST(DevServerProgram, ServesOnAFreePortAndStopsCleanlyOnSIGTERM) {
  TempDir dir;
  const fs::path state = dir.path() / "state";
  Child child = spawn({"--listen", "127.0.0.1:0", "--state-dir", state.string(), "--admin"}, dir.path() / "err");
  const std::string line = readLine(child.stdoutFd);
  std::smatch match;
  const bool announced = std::regex_match(
      line, match, std::regex("zlka-devserver listening on (https://127\\.0\\.0\\.1:([0-9]+)) \\(state in (.*)\\)"));
  if (announced) {
    EXPECT_EQ(match[3].str(), state.string());
    EXPECT_NE(readText(state / "zlkad.toml").find("api = \"" + match[1].str() + "\""), std::string::npos);
    httplib::SSLClient client("127.0.0.1", std::stoi(match[2].str()));
    client.set_ca_cert_path((state / "ca.pem").c_str());
    client.enable_server_certificate_verification(true);
    const auto answer = client.Get("/deviceservices/setup.crt");
    EXPECT_TRUE(answer && answer->status == 200);
    EXPECT_TRUE(client.Get("/_admin/stats"));
  }
  kill(child.pid, SIGTERM);
  EXPECT_EQ(waitFor(child), 0);
  ASSERT_TRUE(announced) << line;
  const std::string log = readText(dir.path() / "err");
  EXPECT_TRUE(std::regex_search(log, std::regex("GET /deviceservices/setup.crt 200 [0-9.]+ ms\n"))) << log;
}

TEST(DevServerProgram, RefusesABadCatalogueWithAMessage) {
  TempDir dir;
  writeText(dir.path() / "catalog.json", R"({"default": {"ppid": "PP"}})");
  Child child =
      spawn({"--state-dir", (dir.path() / "state").string(), "--catalog", (dir.path() / "catalog.json").string()},
            dir.path() / "err");
  EXPECT_EQ(readAll(child.stdoutFd), "");
  EXPECT_EQ(waitFor(child), 1);
  const std::string message = readText(dir.path() / "err");
  EXPECT_NE(message.find("catalog.json"), std::string::npos) << message;
  EXPECT_NE(message.find("default.metadata"), std::string::npos) << message;
}

TEST(DevServerProgram, RefusesBadArguments) {
  TempDir dir;
  const std::vector<std::vector<std::string>> cases = {
      {"--listen", "127.0.0.1"},
      {"--state-dir", (dir.path() / "s").string(), "--listen", "nohost"},
      {"--state-dir", (dir.path() / "s").string(), "--session-validity", "-1"},
      {"--state-dir", (dir.path() / "s").string(), "--catalog", (dir.path() / "absent.json").string()},
      {"--state-dir", (dir.path() / "s").string(), "--unknown"},
  };
  for (const auto& args : cases) {
    SCOPED_TRACE(args.back());
    Child child = spawn(args, dir.path() / "err");
    EXPECT_EQ(readAll(child.stdoutFd).find("listening"), std::string::npos);
    EXPECT_NE(waitFor(child), 0);
    EXPECT_FALSE(readText(dir.path() / "err").empty());
  }
}

TEST(DevServerProgram, HelpDescribesTheOptions) {
  TempDir dir;
  Child child = spawn({"--help"}, dir.path() / "err");
  const std::string help = readAll(child.stdoutFd);
  EXPECT_EQ(waitFor(child), 0);
  for (const char* text : {"--listen", "--state-dir", "--catalog", "--admin", "--session-validity", "/_admin/faults",
                           "deviceservices/setup.crt"}) {
    EXPECT_NE(help.find(text), std::string::npos) << text;
  }
}

}  // namespace
}  // namespace devtest

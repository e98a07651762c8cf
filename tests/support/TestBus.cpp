#include "tests/support/TestBus.h"

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <stdexcept>

namespace platform::testing {
namespace {

std::string escapeXml(const std::string& text) {
  std::string out;
  for (char c : text)
    out += c == '&' ? "&amp;" : c == '<' ? "&lt;" : c == '>' ? "&gt;" : std::string(1, c);
  return out;
}

// A session bus as Debian configures it, minus the system-wide includes.
std::string configuration(const std::string& directory, const TestBus::Options& options) {
  std::string config =
      "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
      " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
      "<busconfig>\n"
      "  <type>session</type>\n"
      "  <keep_umask/>\n"
      "  <listen>unix:dir=" +
      escapeXml(directory) +
      "</listen>\n"
      "  <auth>EXTERNAL</auth>\n";
  for (const std::string& serviceDirectory : options.serviceDirectories)
    config += "  <servicedir>" + escapeXml(serviceDirectory) + "</servicedir>\n";
  config +=
      "  <policy context=\"default\">\n"
      "    <allow send_destination=\"*\" eavesdrop=\"true\"/>\n"
      "    <allow eavesdrop=\"true\"/>\n"
      "    <allow own=\"*\"/>\n"
      "  </policy>\n"
      "  <limit name=\"max_incoming_bytes\">1000000000</limit>\n"
      "  <limit name=\"max_incoming_unix_fds\">250000000</limit>\n"
      "  <limit name=\"max_outgoing_bytes\">1000000000</limit>\n"
      "  <limit name=\"max_outgoing_unix_fds\">250000000</limit>\n"
      "  <limit name=\"max_message_size\">1000000000</limit>\n"
      "  <limit name=\"service_start_timeout\">120000</limit>\n"
      "  <limit name=\"auth_timeout\">240000</limit>\n"
      "  <limit name=\"pending_fd_timeout\">150000</limit>\n"
      "  <limit name=\"max_completed_connections\">100000</limit>\n"
      "  <limit name=\"max_incomplete_connections\">10000</limit>\n"
      "  <limit name=\"max_connections_per_user\">100000</limit>\n"
      "  <limit name=\"max_pending_service_starts\">10000</limit>\n"
      "  <limit name=\"max_names_per_connection\">50000</limit>\n"
      "  <limit name=\"max_match_rules_per_connection\">50000</limit>\n"
      "  <limit name=\"max_replies_per_connection\">50000</limit>\n"
      "</busconfig>\n";
  return config;
}

[[noreturn]] void failWith(const std::string& what) {
  throw std::runtime_error("TestBus: " + what + ": " + std::strerror(errno));
}

}  // namespace

TestBus::TestBus() : TestBus(Options{}) {}

TestBus::TestBus(Options options) {
  std::string pattern = (std::filesystem::temp_directory_path() / "qv-bus-XXXXXX").string();
  if (!::mkdtemp(pattern.data())) failWith("mkdtemp");
  directory_ = pattern;
  const std::string configPath = directory_ + "/bus.conf";
  if (!(std::ofstream(configPath) << configuration(directory_, options))) {
    failWith("writing " + configPath);
  }

  int fds[2];
  if (::pipe2(fds, O_CLOEXEC) != 0) failWith("pipe");
  std::string configArgument = "--config-file=" + configPath;
  const char* argv[] = {"dbus-daemon", configArgument.c_str(), "--nofork", "--print-address=1",
                        nullptr};
  // The daemon's warnings (it cannot raise its fd limit unprivileged) would
  // only clutter test output.
  int devNull = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
  pid_t parent = ::getpid();
  pid_t child = ::fork();
  if (child < 0) failWith("fork");
  if (child == 0) {
    // Only async-signal-safe calls from here to exec.
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (::getppid() != parent) ::_exit(127);
    ::dup2(fds[1], STDOUT_FILENO);
    if (devNull >= 0) ::dup2(devNull, STDERR_FILENO);
    ::execvp("dbus-daemon", const_cast<char* const*>(argv));
    ::_exit(127);
  }
  ::close(fds[1]);
  if (devNull >= 0) ::close(devNull);
  pid_ = child;

  // The daemon prints its address once it listens: wait for that line.
  std::string line;
  char c;
  while (true) {
    ssize_t n = ::read(fds[0], &c, 1);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0 || c == '\n') break;
    line += c;
  }
  ::close(fds[0]);
  if (line.empty()) {
    kill();
    throw std::runtime_error("TestBus: dbus-daemon did not print an address");
  }
  address_ = line;
}

TestBus::~TestBus() {
  kill();
  std::error_code ignored;
  std::filesystem::remove_all(directory_, ignored);
}

void TestBus::kill() {
  if (pid_ <= 0) return;
  ::kill(pid_, SIGTERM);
  int status = 0;
  while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
  }
  pid_ = -1;
}

}  // namespace platform::testing

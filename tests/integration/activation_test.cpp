// The installed quorveld started by D-Bus activation: the build is installed
// into a temporary prefix with `cmake --install`, and a plain session
// dbus-daemon (no systemd) is given that prefix's activation file. The first
// call to the service name must start the installed daemon, which must find
// the installed media worker, and the daemon must leave the bus again once
// idle. The test waits on NameOwnerChanged, never on time.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <sdbus-c++/sdbus-c++.h>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/AudioFixtures.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

using testing::DaemonProcess;
namespace fs = std::filesystem;

constexpr const char* kService = "org.quorvel.SavedRecordingService";
constexpr const char* kPath = "/org/quorvel/SavedRecordingService";
constexpr const char* kInterface = "org.quorvel.SavedRecordingService1";
constexpr const char* kActivationFile = "org.quorvel.SavedRecordingService.service";

std::string readFile(const fs::path& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

// Owner changes of the service name on one bus, as they are announced.
class NameWatch {
 public:
  explicit NameWatch(const std::string& address)
      : connection_(sdbus::createSessionBusConnectionWithAddress(address)) {
    match_ = connection_->addMatch(
        "type='signal',sender='org.freedesktop.DBus',member='NameOwnerChanged',arg0='" +
            std::string(kService) + "'",
        [this](sdbus::Message& message) {
          std::string name, oldOwner, newOwner;
          message >> name >> oldOwner >> newOwner;
          std::lock_guard lock(mutex_);
          owners_.push_back(newOwner);
          changed_.notify_all();
        });
    connection_->enterEventLoopAsync();
  }
  ~NameWatch() { connection_->leaveEventLoop(); }

  // Waits for the `count`th change and returns the owner it announced ("" =
  // the name was released); nullopt after the safety timeout.
  std::optional<std::string> waitForChange(std::size_t count) {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, std::chrono::seconds(60), [&] { return owners_.size() >= count; }))
      return std::nullopt;
    return owners_[count - 1];
  }

  // The process id behind a unique name, from the bus.
  pid_t processOf(const std::string& uniqueName) {
    auto proxy = sdbus::createProxy(*connection_, "org.freedesktop.DBus", "/org/freedesktop/DBus");
    std::uint32_t pid = 0;
    proxy->callMethod("GetConnectionUnixProcessID")
        .onInterface("org.freedesktop.DBus")
        .withArguments(uniqueName)
        .storeResultsTo(pid);
    return pid_t(pid);
  }

 private:
  std::unique_ptr<sdbus::IConnection> connection_;
  sdbus::Slot match_;
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> owners_;
};

class ActivationTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    root_ = new fs::path(fs::temp_directory_path() /
                         ("quorvel-activation-" + std::to_string(getpid())));
    fs::remove_all(*root_);
    auto installed = DaemonProcess::run(
        {"cmake", "--install", QUORVEL_BINARY_DIR, "--prefix", (*root_ / "prefix").string()});
    ASSERT_EQ(installed.status, 0) << installed.output;
  }
  static void TearDownTestSuite() {
    fs::remove_all(*root_);
    delete root_;
  }

  static fs::path prefix() { return *root_ / "prefix"; }

  // The installed activation file, with the idle time made short on its
  // Exec line, in a service directory of its own.
  static fs::path serviceDirectory() {
    const fs::path directory = *root_ / "services";
    fs::create_directories(directory);
    std::string text = readFile(prefix() / "share/dbus-1/services" / kActivationFile);
    const std::string exec = "Exec=" + (prefix() / "bin/quorveld").string() + "\n";
    const auto at = text.find(exec);
    if (at == std::string::npos) return {};
    text.replace(at, exec.size(), exec.substr(0, exec.size() - 1) + " --idle-exit-after 0.2\n");
    std::ofstream(directory / kActivationFile) << text;
    return directory;
  }

  static fs::path* root_;
};

fs::path* ActivationTest::root_ = nullptr;

TEST_F(ActivationTest, InstalledFilesPointIntoThePrefix) {
  const std::string activation = readFile(prefix() / "share/dbus-1/services" / kActivationFile);
  EXPECT_NE(activation.find("Exec=" + (prefix() / "bin/quorveld").string() + "\n"),
            std::string::npos)
      << activation;
  EXPECT_NE(activation.find("SystemdService=quorveld.service"), std::string::npos);
  const std::string unit = readFile(prefix() / "share/systemd/user/quorveld.service");
  EXPECT_NE(unit.find("ExecStart=" + (prefix() / "bin/quorveld").string() + "\n"),
            std::string::npos)
      << unit;
  EXPECT_TRUE(fs::exists(prefix() / "libexec/quorvel/quorvel-media"));
  EXPECT_FALSE(fs::exists(prefix() / "bin/quorvel-media"));  // the daemon must look in libexec
  const std::string pc = readFile(prefix() / "lib/pkgconfig/quorvel.pc");
  EXPECT_NE(pc.find("prefix=" + prefix().string() + "\n"), std::string::npos) << pc;
  EXPECT_TRUE(
      fs::exists(prefix() / "include/quorvel/Quorvel/service/SavedRecordingServiceClient.h"));
}

// The installed user unit stays hardened: the offline analysis (as a user
// manager would run it) rates its exposure 3.0 or less, and the directives
// the daemon relies on are there.
TEST_F(ActivationTest, InstalledUnitExposureIsAtMostThree) {
  const fs::path unit = prefix() / "share/systemd/user/quorveld.service";
  const std::string text = readFile(unit);
  for (const char* directive :
       {"Type=dbus\n", "BusName=org.quorvel.SavedRecordingService\n",
        "Environment=SQLITE_AUTO_TRACE=1\n", "ReadWritePaths=-%h/.local/share/quorvel\n",
        "RestrictAddressFamilies=AF_UNIX\n", "SystemCallFilter=@system-service\n"}) {
    EXPECT_NE(text.find(directive), std::string::npos) << directive;
  }
  if (DaemonProcess::run({"sh", "-c", "command -v systemd-analyze"}).status != 0) {
    GTEST_SKIP() << "systemd-analyze is not installed";
  }
  // The offline analysis still wants a runtime directory for the user.
  const fs::path runtime = *root_ / "runtime";
  fs::create_directories(runtime);
  fs::permissions(runtime, fs::perms::owner_all);
  auto analysed =
      DaemonProcess::run({"env", "XDG_RUNTIME_DIR=" + runtime.string(), "systemd-analyze",
                          "security", "--offline=true", "--user", "--threshold=30", unit.string()});
  EXPECT_EQ(analysed.status, 0) << analysed.output;
  EXPECT_NE(analysed.output.find("Overall exposure level"), std::string::npos) << analysed.output;
}

// The first call starts the installed daemon; an export through it composes
// with the installed worker; once the token is back and the idle time has
// passed, the daemon leaves the bus by itself.
TEST_F(ActivationTest, FirstCallStartsTheInstalledDaemonWhichExitsWhenIdle) {
  const fs::path recordings = *root_ / "Recordings";
  fs::create_directories(recordings);
  const std::string take = (recordings / "take.wav").string();
  ASSERT_TRUE(testing::writeTone(take, 1.0, "wav"));
  auto made = DaemonProcess::run({DaemonProcess::programPath("quorvelctl"), "new",
                                  "--recordings-dir", recordings.string(), "Walk", take});
  ASSERT_EQ(made.status, 0) << made.output;

  // The bus passes its environment on to the services it starts.
  ::setenv("QUORVEL_RECORDINGS_DIR", recordings.c_str(), 1);
  ::unsetenv("QUORVEL_MEDIA_WORKER");
  const fs::path services = serviceDirectory();
  ASSERT_FALSE(services.empty()) << "the installed activation file has no Exec line for the prefix";
  platform::testing::TestBus bus({.serviceDirectories = {services.string()}});
  NameWatch watch(bus.address());

  auto call = [&](const std::string& method, std::vector<std::string> arguments = {}) {
    std::vector<std::string> argv{"gdbus",         "call",
                                  "--address",     bus.address(),
                                  "--dest",        kService,
                                  "--object-path", kPath,
                                  "--method",      std::string(kInterface) + "." + method};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return DaemonProcess::run(argv);
  };
  auto fetched = call("FetchExportingCompositionAVURLs");
  ASSERT_EQ(fetched.status, 0) << fetched.output;
  EXPECT_NE(fetched.output.find("[]"), std::string::npos) << fetched.output;

  auto owner = watch.waitForChange(1);
  ASSERT_TRUE(owner && !owner->empty());
  // The start-up work keeps the daemon on the bus for a while, long enough
  // to ask which program owns the name.
  const pid_t pid = watch.processOf(*owner);
  EXPECT_EQ(fs::read_symlink("/proc/" + std::to_string(pid) + "/exe"), prefix() / "bin/quorveld");

  // quorvelctl holds the export while `true` runs and hands it back; the
  // export is granted only once the worker has composed the recording.
  auto exported = DaemonProcess::run({DaemonProcess::programPath("quorvelctl"), "--bus-address",
                                      bus.address(), "export", (recordings / "Walk.m4a").string(),
                                      "--cache-waveform", "--", "true"});
  ASSERT_EQ(exported.status, 0) << exported.output;
  EXPECT_TRUE(fs::exists(recordings / "Walk.waveform"));

  auto released = watch.waitForChange(2);
  ASSERT_TRUE(released);
  EXPECT_EQ(*released, "");
}

}  // namespace
}  // namespace quorvel

// The installed quorveld started by D-Bus activation: the build is installed
// into a temporary prefix with `cmake --install`, and a plain session
// dbus-daemon (no systemd) is given that prefix's activation file. The first
// call to the service name must start the installed daemon, which must find
// the installed media worker, and the daemon must leave the bus again once
// idle. The test waits on NameOwnerChanged, never on time.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sdbus-c++/sdbus-c++.h>

#include <filesystem>
#include <string>
#include <vector>

#include "tests/support/AudioFixtures.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/Gate.h"
#include "tests/support/ScopedEnvironment.h"
#include "tests/support/TempDirectory.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

using testing::DaemonProcess;
using ::testing::HasSubstr;
using testing::readFile;
namespace fs = std::filesystem;

constexpr const char* kService = "org.quorvel.SavedRecordingService";
constexpr const char* kActivationFile =
    "share/dbus-1/services/org.quorvel.SavedRecordingService.service";

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
          changed_.update([&] { owners_.push_back(newOwner); });
        });
    connection_->enterEventLoopAsync();
  }
  ~NameWatch() { connection_->leaveEventLoop(); }

  // The owner the `count`th change announced ("": the name was released),
  // or nullopt when it did not come.
  std::optional<std::string> waitForChange(std::size_t count) {
    if (!changed_.waitUntil([&] { return owners_.size() >= count; })) return std::nullopt;
    std::lock_guard lock(changed_.mutex());
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
  platform::testing::Gate changed_;
  std::vector<std::string> owners_;  // guarded by changed_
};

class ActivationTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    root_ = new testing::ScopedTempDir("qv-activation");
    auto installed =
        DaemonProcess::run({"cmake", "--install", QUORVEL_BINARY_DIR, "--prefix", prefix()});
    ASSERT_EQ(installed.status, 0) << installed.output;
  }
  static void TearDownTestSuite() { delete root_; }
  static std::string prefix(const std::string& path = "") {
    return path.empty() ? (*root_ / "prefix").string() : (*root_ / "prefix" / path).string();
  }
  static testing::ScopedTempDir* root_;
};

testing::ScopedTempDir* ActivationTest::root_ = nullptr;

// Each installed file names the prefix it went to, the worker is where the
// daemon looks for it, and the user unit stays hardened: the directives the
// daemon relies on are there, and the offline analysis (as a user manager
// would run it) rates its exposure 3.0 or less.
TEST_F(ActivationTest, InstalledFilesPointIntoThePrefixAndTheUnitStaysHardened) {
  const std::string quorveld = prefix("bin/quorveld"), unit = "share/systemd/user/quorveld.service";
  const std::pair<std::string, std::string> contents[] = {
      {kActivationFile, "Exec=" + quorveld + "\n"},
      {kActivationFile, "SystemdService=quorveld.service"},
      {"lib/pkgconfig/quorvel.pc", "prefix=" + prefix() + "\n"},
      {unit, "ExecStart=" + quorveld + "\n"},
      {unit, "Type=dbus\n"},
      {unit, "BusName=org.quorvel.SavedRecordingService\n"},
      {unit, "Environment=SQLITE_AUTO_TRACE=1\n"},
      {unit, "ReadWritePaths=-%h/.local/share/quorvel\n"},
      {unit, "RestrictAddressFamilies=AF_UNIX\n"},
      {unit, "SystemCallFilter=@system-service\n"}};
  for (const auto& [file, text] : contents) EXPECT_THAT(readFile(prefix(file)), HasSubstr(text));
  for (const auto& [file, installed] :
       {std::pair{"libexec/quorvel/quorvel-media", true},
        {"bin/quorvel-media", false},  // the daemon must look in libexec
        {"include/quorvel/Quorvel/service/SavedRecordingServiceClient.h", true}})
    EXPECT_EQ(fs::exists(prefix(file)), installed) << file;

  if (DaemonProcess::run({"sh", "-c", "command -v systemd-analyze"}).status != 0)
    GTEST_SKIP() << "systemd-analyze is not installed";
  // The offline analysis still wants a runtime directory for the user.
  const fs::path runtime = *root_ / "runtime";
  fs::create_directories(runtime);
  fs::permissions(runtime, fs::perms::owner_all);
  auto analysed =
      DaemonProcess::run({"env", "XDG_RUNTIME_DIR=" + runtime.string(), "systemd-analyze",
                          "security", "--offline=true", "--user", "--threshold=30", prefix(unit)});
  EXPECT_EQ(analysed.status, 0) << analysed.output;
  EXPECT_THAT(analysed.output, HasSubstr("Overall exposure level"));
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

  // The installed activation file, with a short idle time on its Exec line,
  // in a service directory of its own; the bus passes its environment on to
  // the services it starts.
  std::string activation = readFile(prefix(kActivationFile));
  const std::string exec = "Exec=" + prefix("bin/quorveld");
  const auto at = activation.find(exec + "\n");
  ASSERT_NE(at, std::string::npos) << "the installed activation file has no Exec line for it";
  activation.insert(at + exec.size(), " --idle-exit-after 0.2");
  testing::writeFile(*root_ / "services" / fs::path(kActivationFile).filename(), activation);
  testing::ScopedEnvironment environment{{"QUORVEL_RECORDINGS_DIR", recordings.c_str()},
                                         {"QUORVEL_MEDIA_WORKER", nullptr}};
  platform::testing::TestBus bus({.serviceDirectories = {(*root_ / "services").string()}});
  NameWatch watch(bus.address());

  auto fetched =
      DaemonProcess::run({"gdbus", "call", "--address", bus.address(), "--dest", kService,
                          "--object-path", "/org/quorvel/SavedRecordingService", "--method",
                          "org.quorvel.SavedRecordingService1.FetchExportingCompositionAVURLs"});
  ASSERT_EQ(fetched.status, 0) << fetched.output;
  EXPECT_THAT(fetched.output, HasSubstr("[]"));
  auto owner = watch.waitForChange(1);
  ASSERT_TRUE(owner && !owner->empty());
  // The start-up work keeps the daemon on the bus for a while, long enough
  // to ask which program owns the name.
  const pid_t pid = watch.processOf(*owner);
  EXPECT_EQ(fs::read_symlink("/proc/" + std::to_string(pid) + "/exe"), prefix("bin/quorveld"));

  // quorvelctl holds the export while `true` runs and hands it back; the
  // export is granted only once the worker has composed the recording.
  auto exported = DaemonProcess::quorvelctl(
      bus.address(),
      {"export", (recordings / "Walk.m4a").string(), "--cache-waveform", "--", "true"});
  ASSERT_EQ(exported.status, 0) << exported.output;
  EXPECT_TRUE(fs::exists(recordings / "Walk.waveform"));
  EXPECT_EQ(watch.waitForChange(2), "");
}

}  // namespace
}  // namespace quorvel

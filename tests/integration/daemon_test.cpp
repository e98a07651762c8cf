// The real quorveld on a private bus, called the way apps and users call it:
// the client library, quorvelctl, gdbus and dbus-send. Checks what each sees
// and what the daemon logs.
#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>

#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/service/SavedRecordingServiceClient.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

using testing::DaemonProcess;

constexpr const char* kService = "org.quorvel.SavedRecordingService";
constexpr const char* kPath = "/org/quorvel/SavedRecordingService";
constexpr const char* kInterface = "org.quorvel.SavedRecordingService1";

class DaemonTest : public ::testing::Test {
 protected:
  void SetUp() override {
    recordings_ = std::filesystem::temp_directory_path() /
                  ("quorvel-it-" + std::to_string(getpid()) + "-" +
                   ::testing::UnitTest::GetInstance()->current_test_info()->name());
    std::filesystem::remove_all(recordings_);
  }
  void TearDown() override {
    std::filesystem::remove_all(recordings_);
    for (int i = 0; i < 3; ++i)
      std::filesystem::remove(recordings_.string() + "-take" + std::to_string(i) + ".wav");
  }

  std::unique_ptr<DaemonProcess> startDaemon(const std::string& idleExitAfter = "0") {
    auto daemon = std::make_unique<DaemonProcess>(
        std::vector<std::string>{"--bus-address", bus_.address(), "--recordings-dir",
                                 recordings_.string(), "--idle-exit-after", idleExitAfter});
    // Logged once the name is ours.
    EXPECT_TRUE(daemon->waitForLine("[BusListener] listening as")) << daemon->output();
    return daemon;
  }
  DaemonProcess::CommandResult gdbusCall(const std::string& method,
                                         std::vector<std::string> arguments = {}) {
    std::vector<std::string> argv{"gdbus",         "call",
                                  "--address",     bus_.address(),
                                  "--dest",        kService,
                                  "--object-path", kPath,
                                  "--method",      std::string(kInterface) + "." + method};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return DaemonProcess::run(argv);
  }
  DaemonProcess::CommandResult quorvelctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(),
                     {DaemonProcess::programPath("quorvelctl"), "--bus-address", bus_.address()});
    return DaemonProcess::run(arguments);
  }

  platform::testing::TestBus bus_;
  std::filesystem::path recordings_;
};

TEST_F(DaemonTest, StartsOwnsItsNameAndLogsTheStartUp) {
  auto daemon = startDaemon();
  EXPECT_EQ(daemon->linesContaining("[quorveld] Starting xpc service").size(), 1u);
  EXPECT_EQ(daemon
                ->linesContaining(
                    "[SavedRecordingService] Starting service 'org.quorvel.SavedRecordingService'")
                .size(),
            1u);
  EXPECT_TRUE(daemon->waitForLine("[RCSXPCTransaction] Root XPC transaction began."));
  EXPECT_TRUE(std::filesystem::is_directory(recordings_));

  auto introspection = DaemonProcess::run({"gdbus", "introspect", "--address", bus_.address(),
                                           "--dest", kService, "--object-path", kPath});
  ASSERT_EQ(introspection.status, 0) << introspection.output;
  EXPECT_NE(introspection.output.find("interface org.quorvel.SavedRecordingService1"),
            std::string::npos);
  EXPECT_NE(introspection.output.find("PrepareToExport(in  s compositionAVURL,"), std::string::npos)
      << introspection.output;
}

TEST_F(DaemonTest, ClientLibraryGetsAnswersAndErrorsAsValues) {
  auto daemon = startDaemon();
  auto client = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(client) << client.error();

  auto exporting = (*client)->fetchExportingCompositionAVURLs();
  ASSERT_TRUE(exporting) << exporting.error();
  EXPECT_TRUE(exporting->empty());

  // Two previews share the recording; a capture beside them is refused.
  auto url = platform::URL::fileURLWithPath(recordings_.string() + "/Walk in the park.m4a");
  auto first = (*client)->prepareToPreview(url);
  auto second = (*client)->prepareToPreview(url);
  ASSERT_TRUE(first && second) << daemon->output();
  EXPECT_EQ(first->accessType(), 1);
  EXPECT_FALSE(*first == *second);
  auto capture = (*client)->prepareToCapture(url);
  ASSERT_FALSE(capture);
  EXPECT_EQ(capture.error().domain(), "org.quorvel.SavedRecordingService.ErrorDomain");
  EXPECT_EQ(capture.error().code(), 301);
  EXPECT_TRUE(daemon->waitForLine(
      "[SavedRecordingService] Received request to prepare 'Walk in the park.m4a' for capture..."));

  // Once both are handed back (one through another connection: tokens are
  // capabilities), the capture is granted.
  (*client)->endAccessSessionWithToken(*first);
  auto other = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(other);
  (*other)->endAccessSessionWithToken(*second);
  EXPECT_TRUE(daemon->waitForLines("Finally closing access session", 2)) << daemon->output();
  auto granted = (*client)->prepareToCapture(url);
  ASSERT_TRUE(granted) << granted.error();
  EXPECT_EQ(granted->accessType(), 2);
}

TEST_F(DaemonTest, AKilledClientsSessionsCloseAndTheRecordingIsFreed) {
  auto daemon = startDaemon();
  std::string recording = recordings_.string() + "/Held.m4a";
  // quorvelctl holds a capture session while its command runs; the command
  // says its pid so the test can end it once quorvelctl is gone.
  DaemonProcess holder(DaemonProcess::programPath("quorvelctl"),
                       {"--bus-address", bus_.address(), "capture", recording, "--", "sh", "-c",
                        "echo held $$ >&2; exec sleep 600"});
  ASSERT_TRUE(holder.waitForLine("held ")) << holder.output() << daemon->output();
  pid_t command = std::stoi(holder.linesContaining("held ").at(0).substr(5));

  auto refused = quorvelctl({"trim", recording});
  EXPECT_EQ(refused.status, 1);
  EXPECT_NE(refused.output.find("quorvelctl: org.quorvel.SavedRecordingService.Error."
                                "ConflictingSession (301): Error Domain="),
            std::string::npos)
      << refused.output;

  holder.sendSignal(SIGKILL);
  ::kill(command, SIGKILL);
  EXPECT_EQ(holder.waitForExit(), -SIGKILL);
  EXPECT_TRUE(daemon->waitForLine("Terminating access session")) << daemon->output();
  EXPECT_TRUE(daemon->waitForLine("for terminated connection: <connection :1."));
  EXPECT_TRUE(daemon->waitForLine("Closing access session"));

  // The recording is free again; quorvelctl holds a trim while `true` runs
  // and hands it back whatever the outcome.
  auto trimmed = quorvelctl({"trim", recording, "--", "true"});
  EXPECT_EQ(trimmed.status, 0) << trimmed.output << daemon->output();
  auto failed = quorvelctl({"capture", recording, "--", "false"});
  EXPECT_EQ(failed.status, 1) << failed.output;
  EXPECT_EQ(quorvelctl({"capture", recording, "--", "true"}).status, 0) << daemon->output();
  daemon->sendSignal(SIGUSR1);
  EXPECT_TRUE(daemon->waitForLine("*** No Active Sessions ***"));
}

// A recording made with quorvelctl from three files is exported with its
// waveform over the bus: the composed file decodes to the fragments' length
// within one AAC frame per join, and the waveform covers the same length.
TEST_F(DaemonTest, AnExportComposesTheFragmentsAndCachesTheWaveform) {
  auto daemon = startDaemon();
  std::filesystem::create_directories(recordings_);
  std::vector<std::string> made{"new", "--recordings-dir", recordings_.string(), "Walk"};
  const double seconds[] = {1.5, 0.75, 1.0};
  for (int i = 0; i < 3; ++i) {
    // Outside the recordings directory, where the orphan recovery run would
    // take them for recordings of their own.
    std::string file = (recordings_.string() + "-take" + std::to_string(i) + ".wav");
    ASSERT_TRUE(testing::writeTone(file, seconds[i], "wav"));
    made.push_back(file);
  }
  auto created = quorvelctl(made);
  ASSERT_EQ(created.status, 0) << created.output;
  const std::filesystem::path audio = recordings_ / "Walk.m4a";

  auto exported = quorvelctl({"export", audio.string(), "--cache-waveform", "--", "true"});
  ASSERT_EQ(exported.status, 0) << exported.output << daemon->output();
  auto pcm = testing::decodeToPCM(audio.string());
  ASSERT_TRUE(pcm) << pcm.error();
  constexpr double kAACFrame = 1024.0 / 44100.0;  // the longer of the rates we write
  EXPECT_NEAR(pcm->seconds(), 3.25, 2 * kAACFrame + 0.001);
  auto waveform =
      RCReadWaveformFile(platform::URL::fileURLWithPath((recordings_ / "Walk.waveform").string()));
  ASSERT_TRUE(waveform) << waveform.error();
  EXPECT_NEAR(double(waveform->length() * waveform->samplesPerPixel()) / waveform->sampleRate(),
              pcm->seconds(), 0.05);
  // The database's duration follows the composed audio.
  auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
  ASSERT_TRUE(model);
  auto recording = (*model)->recordingWithURL(platform::URL::fileURLWithPath(audio.string()));
  ASSERT_TRUE(recording && *recording);
  EXPECT_NEAR((*recording)->duration(), 3.25, 0.1);
  auto info = quorvelctl({"info", "--recordings-dir", recordings_.string(), audio.string()});
  EXPECT_EQ(info.output.find("not composed"), std::string::npos) << info.output;
}

// A directory seeded with orphans: the run (here the one that enabling
// orphan handling starts, which answers after it) keeps one of two identical
// files and recovers it with the title stored in it, deletes the unplayable
// file, and leaves what is not a recording alone.
TEST_F(DaemonTest, OrphansDroppedIntoTheDirectoryAreRecoveredOrRemoved) {
  std::filesystem::create_directories(recordings_);
  auto path = [&](const char* name) { return (recordings_ / name).string(); };
  ASSERT_TRUE(testing::writeTone(path("Found.m4a"), 1.0, "m4a"));
  ASSERT_TRUE(RCMediaEngine::current()->writeTitle(
      platform::URL::fileURLWithPath(path("Found.m4a")), "Found on a card", ""));
  std::filesystem::copy_file(path("Found.m4a"), path("Found again.m4a"));
  std::filesystem::copy_file(path("Found.m4a"), path("notes.txt"));
  {
    std::ofstream noise(path("Noise.wav"));
    noise << std::string(4096, 'x');
  }
  auto daemon = startDaemon();
  auto enabled = quorvelctl({"enable-orphan-handling"});
  ASSERT_EQ(enabled.status, 0) << enabled.output;

  EXPECT_TRUE(std::filesystem::exists(path("Found.m4a")));
  EXPECT_TRUE(std::filesystem::exists(path("notes.txt")));
  EXPECT_FALSE(std::filesystem::exists(path("Found again.m4a"))) << daemon->output();
  EXPECT_FALSE(std::filesystem::exists(path("Noise.wav")));
  auto listed = quorvelctl({"list", "--recordings-dir", recordings_.string()});
  ASSERT_EQ(listed.status, 0) << listed.output;
  EXPECT_NE(listed.output.find("Found on a card"), std::string::npos) << listed.output;
  EXPECT_EQ(listed.output.find("Noise"), std::string::npos) << listed.output;
}

TEST_F(DaemonTest, ForeignClientsGetTheContractsErrors) {
  auto daemon = startDaemon();
  auto missing = gdbusCall("PrepareToCapture", {""});
  EXPECT_NE(missing.status, 0);
  EXPECT_NE(missing.output.find("org.quorvel.SavedRecordingService.Error.MissingCompositionAVURL"),
            std::string::npos)
      << missing.output;
  EXPECT_NE(missing.output.find("Code=101"), std::string::npos);
  EXPECT_TRUE(
      daemon->waitForLine(".  compositionAVURL parameter is required for invocations of "
                          "-prepareToCaptureToCompositionAVURL:accessRequestHandler:"));

  auto wrongSignature = DaemonProcess::run(
      {"dbus-send", "--bus=" + bus_.address(), "--print-reply", "--dest=" + std::string(kService),
       kPath, std::string(kInterface) + ".PrepareToCapture", "int32:7"});
  EXPECT_NE(wrongSignature.output.find("org.freedesktop.DBus.Error.InvalidArgs"), std::string::npos)
      << wrongSignature.output;
  auto unknown = gdbusCall("NoSuchMethod");
  EXPECT_NE(unknown.output.find("org.freedesktop.DBus.Error.UnknownMethod"), std::string::npos)
      << unknown.output;

  // The daemon keeps serving.
  auto fetched = gdbusCall("FetchExportingCompositionAVURLs");
  EXPECT_EQ(fetched.status, 0) << fetched.output;
  EXPECT_NE(fetched.output.find("(@as [],)"), std::string::npos) << fetched.output;

  // Launch events: a named one is posted in-process, one without a name is
  // logged and ignored.
  auto emit = [this](std::vector<std::string> arguments) {
    std::vector<std::string> argv{"dbus-send", "--bus=" + bus_.address(), "--type=signal", "/",
                                  "org.quorvel.Events1.Event"};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return DaemonProcess::run(argv);
  };
  EXPECT_EQ(emit({}).status, 0);
  EXPECT_TRUE(daemon->waitForLine("Ignoring a launch event without a name"));
  EXPECT_EQ(emit({"string:com.example.RecordingsChanged"}).status, 0);
  EXPECT_TRUE(daemon->waitForLine("Posting launch event 'com.example.RecordingsChanged'"));
}

TEST_F(DaemonTest, QuorvelctlReportsResultsAndErrorsByExitStatus) {
  auto daemon = startDaemon();
  auto fetched = quorvelctl({"--json", "fetch-exporting"});
  EXPECT_EQ(fetched.status, 0) << fetched.output;
  EXPECT_EQ(fetched.output, "{\"compositionAVURLs\":[]}\n");
  // Global options may follow the subcommand too.
  EXPECT_EQ(quorvelctl({"fetch-exporting", "--json"}).output, fetched.output);

  auto captured = quorvelctl({"capture", recordings_.string() + "/x.m4a"});
  EXPECT_EQ(captured.status, 0) << captured.output;
  EXPECT_EQ(captured.output.rfind("capture 2 file://", 0), 0u) << captured.output;
  // quorvelctl's connection ends with it, and so does that session.

  auto usage = quorvelctl({"end", "capture", "two", "file:///x.m4a", "nope"});
  EXPECT_EQ(usage.status, 2) << usage.output;

  auto unreachable = DaemonProcess::run({DaemonProcess::programPath("quorvelctl"), "--bus-address",
                                         "unix:path=/nonexistent/bus", "fetch-exporting"});
  EXPECT_EQ(unreachable.status, 3) << unreachable.output;
}

TEST_F(DaemonTest, DebugSignalDumpsWithoutEndingTheProcess) {
  auto daemon = startDaemon();
  daemon->sendSignal(SIGUSR1);
  EXPECT_TRUE(daemon->waitForLine("*** No Active Sessions ***"));
  daemon->sendSignal(SIGUSR1);
  EXPECT_TRUE(daemon->waitForLine("*** No Active Sessions ***"));
  auto fetched = gdbusCall("FetchExportingCompositionAVURLs");
  EXPECT_EQ(fetched.status, 0) << fetched.output << daemon->output();
}

TEST_F(DaemonTest, BadOptionsExitWithUsageStatusAndAMessage) {
  for (const char* idle : {"-3", "soon"}) {
    DaemonProcess daemon({"--bus-address", bus_.address(), "--idle-exit-after", idle});
    EXPECT_EQ(daemon.waitForExit(), 2);
    EXPECT_NE(daemon.output().find("--idle-exit-after: must be a number of seconds, 0 or more"),
              std::string::npos)
        << daemon.output();
  }
  auto info = DaemonProcess::run({DaemonProcess::programPath("quorveld"), "--info"});
  EXPECT_EQ(info.status, 0);
  EXPECT_NE(info.output.find("\"LSEnvironment\": {\"SQLITE_AUTO_TRACE\": \"1\"}"),
            std::string::npos)
      << info.output;
}

TEST_F(DaemonTest, ExitsByItselfOnceIdleAndASecondDaemonIsRefused) {
  auto daemon = startDaemon("1");
  // A second daemon cannot own the name: a clear message and status 1.
  DaemonProcess second({"--bus-address", bus_.address(), "--recordings-dir", recordings_.string()});
  EXPECT_EQ(second.waitForExit(), 1);
  EXPECT_NE(second.output().find("quorveld: cannot serve org.quorvel.SavedRecordingService"),
            std::string::npos)
      << second.output();

  EXPECT_EQ(daemon->waitForExit(), 0) << daemon->output();
  EXPECT_EQ(
      daemon->linesContaining("No XPC transactions remain. Ending root XPC transaction.").size(),
      1u);
  EXPECT_EQ(daemon->linesContaining("[quorveld] Exiting xpc service").size(), 1u);
}

}  // namespace
}  // namespace quorvel

// The real quorveld on a private bus, called the way apps and users call it:
// one end-to-end run per kind of client (the client library, quorvelctl,
// gdbus and dbus-send), and what only a real process shows: its options, a
// killed client, its sandboxed media worker, the debug signal, its idle exit.
// The rules behind the answers are pinned by the service core's tests.
#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>

#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/service/SavedRecordingServiceClient.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/ScopedTempDir.h"
#include "tests/support/TempDirectory.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

using testing::DaemonProcess;
namespace fs = std::filesystem;

class DaemonTest : public ::testing::Test {
 protected:
  std::unique_ptr<DaemonProcess> serve(const std::string& idleExitAfter = "0") {
    return DaemonProcess::serve(bus_.address(), recordings_.string(), idleExitAfter);
  }
  DaemonProcess::CommandResult quorvelctl(std::vector<std::string> arguments) {
    return DaemonProcess::quorvelctl(bus_.address(), std::move(arguments));
  }
  DaemonProcess::CommandResult gdbus(const std::string& command,
                                     std::vector<std::string> arguments = {}) {
    arguments.insert(arguments.begin(), {"gdbus", command, "--address", bus_.address(), "--dest",
                                         "org.quorvel.SavedRecordingService", "--object-path",
                                         "/org/quorvel/SavedRecordingService"});
    return DaemonProcess::run(arguments);
  }
  DaemonProcess::CommandResult call(const std::string& method,
                                    std::vector<std::string> arguments = {}) {
    arguments.insert(arguments.begin(),
                     {"--method", "org.quorvel.SavedRecordingService1." + method});
    return gdbus("call", std::move(arguments));
  }
  std::string path(const std::string& name) const { return (recordings_ / name).string(); }

  platform::testing::TestBus bus_;
  testing::ScopedTempDir temp_{"qv-daemon"};
  fs::path recordings_ = temp_ / "Recordings";  // made by the daemon
};

TEST_F(DaemonTest, TheClientLibraryGetsAnswersAndErrorsAsValues) {
  auto daemon = serve();
  EXPECT_EQ(daemon->linesContaining("[quorveld] Starting xpc service").size(), 1u);
  EXPECT_TRUE(fs::is_directory(recordings_));
  auto client = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(client) << client.error();
  auto exporting = (*client)->fetchExportingCompositionAVURLs();
  ASSERT_TRUE(exporting) << exporting.error();
  EXPECT_TRUE(exporting->empty());

  auto url = platform::URL::fileURLWithPath(path("Walk in the park.m4a"));
  auto preview = (*client)->prepareToPreview(url);
  ASSERT_TRUE(preview) << daemon->output();
  EXPECT_EQ(preview->accessType(), 1);
  auto capture = (*client)->prepareToCapture(url);
  ASSERT_FALSE(capture);
  EXPECT_EQ(capture.error().domain(), "org.quorvel.SavedRecordingService.ErrorDomain");
  EXPECT_EQ(capture.error().code(), 301);
  (*client)->endAccessSessionWithToken(*preview);
  EXPECT_TRUE(daemon->waitForLine("Finally closing access session")) << daemon->output();
  auto granted = (*client)->prepareToCapture(url);
  ASSERT_TRUE(granted) << granted.error();
  EXPECT_EQ(granted->accessType(), 2);
}

// quorvelctl holds a session while its command runs and reports by exit
// status; a killed one loses its sessions; the debug signal dumps them, as
// often as it comes, and the daemon keeps serving.
TEST_F(DaemonTest, QuorvelctlHoldsSessionsWhileItsCommandRunsAndReportsByExitStatus) {
  auto daemon = serve();
  auto fetched = quorvelctl({"--json", "fetch-exporting"});
  EXPECT_EQ(fetched.status, 0) << fetched.output;
  EXPECT_EQ(fetched.output, "{\"compositionAVURLs\":[]}\n");
  EXPECT_EQ(quorvelctl({"fetch-exporting", "--json"}).output,
            fetched.output);  // options follow too
  auto captured = quorvelctl({"capture", path("x.m4a")});
  EXPECT_EQ(captured.status, 0) << captured.output;
  EXPECT_TRUE(captured.output.starts_with("capture 2 file://")) << captured.output;
  EXPECT_EQ(quorvelctl({"end", "capture", "two", "file:///x.m4a", "nope"}).status, 2);
  EXPECT_EQ(DaemonProcess::quorvelctl("unix:path=/nonexistent/bus", {"fetch-exporting"}).status, 3);

  // The command says its pid, so the test can end it once quorvelctl is gone.
  const std::string recording = path("Held.m4a");
  DaemonProcess holder(DaemonProcess::programPath("quorvelctl"),
                       {"--bus-address", bus_.address(), "capture", recording, "--", "sh", "-c",
                        "echo held $$ >&2; exec sleep 600"});
  ASSERT_TRUE(holder.waitForLine("held ")) << holder.output() << daemon->output();
  const pid_t command = std::stoi(holder.linesContaining("held ").at(0).substr(5));
  auto refused = quorvelctl({"trim", recording});
  EXPECT_EQ(refused.status, 1);
  EXPECT_TRUE(
      refused.output.starts_with("quorvelctl: org.quorvel.SavedRecordingService.Error."
                                 "ConflictingSession (301): Error Domain="))
      << refused.output;
  holder.sendSignal(SIGKILL);
  ::kill(command, SIGKILL);
  EXPECT_EQ(holder.waitForExit(), -SIGKILL);
  EXPECT_TRUE(daemon->waitForLine("for terminated connection")) << daemon->output();

  EXPECT_EQ(quorvelctl({"trim", recording, "--", "true"}).status, 0) << daemon->output();
  EXPECT_EQ(quorvelctl({"capture", recording, "--", "false"}).status, 1);
  EXPECT_EQ(quorvelctl({"capture", recording, "--", "true"}).status, 0) << daemon->output();
  daemon->sendSignal(SIGUSR1);
  EXPECT_TRUE(daemon->waitForLines("*** No Active Sessions ***", 1));
  daemon->sendSignal(SIGUSR1);
  EXPECT_TRUE(daemon->waitForLines("*** No Active Sessions ***", 2));
  EXPECT_EQ(quorvelctl({"fetch-exporting"}).status, 0) << daemon->output();
}

TEST_F(DaemonTest, ForeignClientsGetTheInterfaceAndItsErrors) {
  auto daemon = serve();
  auto introspection = gdbus("introspect");
  ASSERT_EQ(introspection.status, 0) << introspection.output;
  EXPECT_NE(introspection.output.find("interface org.quorvel.SavedRecordingService1"),
            std::string::npos);
  EXPECT_NE(introspection.output.find("PrepareToExport(in  s compositionAVURL,"), std::string::npos)
      << introspection.output;

  auto missing = call("PrepareToCapture", {""});
  EXPECT_NE(missing.status, 0);
  EXPECT_NE(missing.output.find("org.quorvel.SavedRecordingService.Error.MissingCompositionAVURL"),
            std::string::npos)
      << missing.output;
  EXPECT_NE(missing.output.find("Code=101"), std::string::npos);
  auto dbusSend = [&](std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {"dbus-send", "--bus=" + bus_.address()});
    return DaemonProcess::run(arguments);
  };
  auto wrongSignature =
      dbusSend({"--print-reply", "--dest=org.quorvel.SavedRecordingService",
                "/org/quorvel/SavedRecordingService",
                "org.quorvel.SavedRecordingService1.PrepareToCapture", "int32:7"});
  EXPECT_NE(wrongSignature.output.find("org.freedesktop.DBus.Error.InvalidArgs"), std::string::npos)
      << wrongSignature.output;
  auto unknown = call("NoSuchMethod");
  EXPECT_NE(unknown.output.find("org.freedesktop.DBus.Error.UnknownMethod"), std::string::npos)
      << unknown.output;
  auto fetched = call("FetchExportingCompositionAVURLs");
  EXPECT_EQ(fetched.status, 0) << fetched.output;
  EXPECT_NE(fetched.output.find("(@as [],)"), std::string::npos) << fetched.output;

  // Launch events from the bus, without a name and with one.
  EXPECT_EQ(dbusSend({"--type=signal", "/", "org.quorvel.Events1.Event"}).status, 0);
  EXPECT_TRUE(daemon->waitForLine("Ignoring a launch event without a name"));
  EXPECT_EQ(dbusSend({"--type=signal", "/", "org.quorvel.Events1.Event",
                      "string:com.example.RecordingsChanged"})
                .status,
            0);
  EXPECT_TRUE(daemon->waitForLine("Posting launch event 'com.example.RecordingsChanged'"));
}

// The media worker, in its sandbox, reads the orphans dropped into the
// directory (keeping one of two identical files, with the title stored in
// it, and deleting the unplayable one) and composes an export of a
// recording made with quorvelctl from three files, with its waveform: the
// composed file decodes to the fragments' length within one AAC frame per
// join, and the waveform and the database follow it.
TEST_F(DaemonTest, TheSandboxedWorkerRecoversOrphansAndComposesAnExport) {
  fs::create_directories(recordings_);
  ASSERT_TRUE(testing::writeTone(path("Found.m4a"), 1.0, "m4a"));
  ASSERT_TRUE(RCMediaEngine::current()->writeTitle(
      platform::URL::fileURLWithPath(path("Found.m4a")), "Found on a card", ""));
  fs::copy_file(path("Found.m4a"), path("Found again.m4a"));
  fs::copy_file(path("Found.m4a"), path("notes.txt"));
  testing::writeFile(path("Noise.wav"), std::string(4096, 'x'));
  auto daemon = serve();
  auto enabled = quorvelctl({"enable-orphan-handling"});  // answers after its run
  ASSERT_EQ(enabled.status, 0) << enabled.output;
  EXPECT_TRUE(fs::exists(path("Found.m4a")));
  EXPECT_TRUE(fs::exists(path("notes.txt")));
  EXPECT_FALSE(fs::exists(path("Found again.m4a"))) << daemon->output();
  EXPECT_FALSE(fs::exists(path("Noise.wav")));
  auto listed = quorvelctl({"list", "--recordings-dir", recordings_.string()});
  EXPECT_NE(listed.output.find("Found on a card"), std::string::npos) << listed.output;

  std::vector<std::string> made{"new", "--recordings-dir", recordings_.string(), "Walk"};
  for (double seconds : {1.5, 0.75, 1.0}) {
    made.push_back(temp_ / ("take" + std::to_string(made.size()) + ".wav"));
    ASSERT_TRUE(testing::writeTone(made.back(), seconds, "wav"));
  }
  auto created = quorvelctl(made);
  ASSERT_EQ(created.status, 0) << created.output;
  auto exported = quorvelctl({"export", path("Walk.m4a"), "--cache-waveform", "--", "true"});
  ASSERT_EQ(exported.status, 0) << exported.output << daemon->output();
  auto pcm = testing::decodeToPCM(path("Walk.m4a"));
  ASSERT_TRUE(pcm) << pcm.error();
  EXPECT_NEAR(pcm->seconds(), 3.25, 2 * 1024.0 / 44100.0 + 0.001);
  auto waveform = RCReadWaveformFile(platform::URL::fileURLWithPath(path("Walk.waveform")));
  ASSERT_TRUE(waveform) << waveform.error();
  EXPECT_NEAR(double(waveform->length() * waveform->samplesPerPixel()) / waveform->sampleRate(),
              pcm->seconds(), 0.05);
  auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
  ASSERT_TRUE(model);
  auto recording = (*model)->recordingWithURL(platform::URL::fileURLWithPath(path("Walk.m4a")));
  ASSERT_TRUE(recording && *recording);
  EXPECT_NEAR((*recording)->duration(), 3.25, 0.1);
  auto info = quorvelctl({"info", "--recordings-dir", recordings_.string(), path("Walk.m4a")});
  EXPECT_EQ(info.output.find("not composed"), std::string::npos) << info.output;
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
  auto daemon = serve("1");
  DaemonProcess second({"--bus-address", bus_.address(), "--recordings-dir", recordings_.string()});
  EXPECT_EQ(second.waitForExit(), 1);
  EXPECT_NE(second.output().find("quorveld: cannot serve org.quorvel.SavedRecordingService"),
            std::string::npos)
      << second.output();
  EXPECT_EQ(daemon->waitForExit(), 0) << daemon->output();
  EXPECT_EQ(daemon->linesContaining("[quorveld] Exiting xpc service").size(), 1u);
}

}  // namespace
}  // namespace quorvel

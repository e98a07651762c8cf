// The real quorveld on a private bus, called the way apps and users call it:
// one end-to-end run per kind of client (the client library, quorvelctl,
// gdbus and dbus-send), and what only a real process shows: its options, a
// killed client, its sandboxed media workers (which die with it, may be
// missing, or be killed mid-export), the debug signal, its idle exit, and
// its recordings directory on a full disk. The rules behind the answers are
// pinned by the service core's tests.
#include <fcntl.h>
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <thread>
#include <tuple>
#include <utility>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCMD5.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/service/SavedRecordingServiceClient.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/DirectoryWatch.h"
#include "tests/support/ScopedEnvironment.h"
#include "tests/support/TempDirectory.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

using testing::DaemonProcess;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::StartsWith;
namespace fs = std::filesystem;

class DaemonTest : public ::testing::Test {
 protected:
  void TearDown() override {
    endCommands();
    holders_.clear();
    RCSavedRecordingsModel::resetSharedModelsForTesting();
    RCSavedRecordingsModel::setSavedRecordingsDirectory(std::nullopt);
  }
  // Makes the recordings directory (the daemon makes its own) and the test
  // process's.
  void useRecordings() {
    fs::create_directories(recordings_);
    RCSavedRecordingsModel::setSavedRecordingsDirectory(recordings_.string());
  }
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
  std::string path(const std::string& name) const { return (recordings_ / name).string(); }
  std::unique_ptr<SavedRecordingServiceClient> connect() {
    auto client = SavedRecordingServiceClient::connect(bus_.address());
    EXPECT_TRUE(client) << client.error();
    return client ? std::move(*client) : nullptr;
  }
  // quorvelctl holding a `kind` session of `recording` in the background,
  // once granted. Its command says its pid, so endCommands() can end it: it
  // would otherwise keep quorvelctl's stderr open.
  DaemonProcess& hold(const std::string& kind, const std::string& recording) {
    auto& holder = *holders_.emplace_back(std::make_unique<DaemonProcess>(
        DaemonProcess::programPath("quorvelctl"),
        std::vector<std::string>{"--bus-address", bus_.address(), kind, recording, "--", "sh", "-c",
                                 "echo held $$ >&2; exec sleep 600"}));
    EXPECT_TRUE(holder.waitForLine("held ")) << holder.output();
    for (const auto& line : holder.linesContaining("held "))
      commands_.push_back(std::stoi(line.substr(5)));
    return holder;
  }
  void endCommands() {
    for (pid_t command : std::exchange(commands_, {})) ::kill(command, SIGKILL);
  }

  platform::testing::TestBus bus_;
  testing::ScopedTempDir temp_{"qv-daemon"};
  fs::path recordings_ = temp_ / "Recordings";  // made by the daemon
  std::vector<std::unique_ptr<DaemonProcess>> holders_;
  std::vector<pid_t> commands_;
};

TEST_F(DaemonTest, TheClientLibraryGetsAnswersAndErrorsAsValues) {
  auto daemon = serve();
  EXPECT_EQ(daemon->linesContaining("[quorveld] Starting xpc service").size(), 1u);
  EXPECT_TRUE(fs::is_directory(recordings_));
  auto client = connect();
  ASSERT_TRUE(client);
  auto exporting = client->fetchExportingCompositionAVURLs();
  ASSERT_TRUE(exporting) << exporting.error();
  EXPECT_TRUE(exporting->empty());

  auto url = platform::URL::fileURLWithPath(path("Walk in the park.m4a"));
  auto preview = client->prepareToPreview(url);
  ASSERT_TRUE(preview) << daemon->output();
  EXPECT_EQ(preview->accessType(), 1);
  auto capture = client->prepareToCapture(url);
  ASSERT_FALSE(capture);
  EXPECT_EQ(capture.error().domain(), "org.quorvel.SavedRecordingService.ErrorDomain");
  EXPECT_EQ(capture.error().code(), 301);
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
  EXPECT_THAT(captured.output, StartsWith("capture 2 file://"));
  EXPECT_EQ(quorvelctl({"end", "capture", "two", "file:///x.m4a", "nope"}).status, 2);
  EXPECT_EQ(DaemonProcess::quorvelctl("unix:path=/nonexistent/bus", {"fetch-exporting"}).status, 3);

  const std::string recording = path("Held.m4a");
  DaemonProcess& holder = hold("capture", recording);
  holder.sendSignal(SIGKILL);
  endCommands();
  EXPECT_EQ(holder.waitForExit(), -SIGKILL);
  EXPECT_TRUE(daemon->waitForLine("for terminated connection")) << daemon->output();

  EXPECT_EQ(quorvelctl({"trim", recording, "--", "true"}).status, 0) << daemon->output();
  EXPECT_EQ(quorvelctl({"capture", recording, "--", "false"}).status, 1);
  EXPECT_EQ(quorvelctl({"capture", recording, "--", "true"}).status, 0) << daemon->output();
  for (std::size_t dumps : {1, 2}) {
    daemon->sendSignal(SIGUSR1);
    EXPECT_TRUE(daemon->waitForLines("*** No Active Sessions ***", dumps));
  }
  EXPECT_EQ(quorvelctl({"fetch-exporting"}).status, 0) << daemon->output();
}

// Who holds a recording, seen from real client processes: the listing names
// each holder as the bus knows it, a --wait that runs out says who holds it,
// and one without a limit asks again on the recording's change signal.
TEST_F(DaemonTest, SessionsNameTheirHoldersAndWaitingEndsWhenTheHolderGoes) {
  auto daemon = serve();
  const std::string walk = path("Walk.m4a"), memo = path("Memo.m4a");
  const DaemonProcess& capturing = hold("capture", walk);
  const DaemonProcess& previewing = hold("preview", memo);
  auto listed = quorvelctl({"--json", "sessions"});
  ASSERT_EQ(listed.status, 0) << listed.output;
  auto sessions = nlohmann::json::parse(listed.output).at("sessions");
  ASSERT_EQ(sessions.size(), 2u) << listed.output;
  for (const auto& [holder, kind, file] :
       {std::tuple{&capturing, "capture", walk}, {&previewing, "preview", memo}}) {
    auto found = std::ranges::find(sessions, std::string(kind), [](const auto& session) {
      return session.at("kind").template get<std::string>();
    });
    ASSERT_NE(found, sessions.end()) << listed.output;
    const nlohmann::json expected = {
        {"pid", holder->pid()},
        {"uid", ::getuid()},
        {"command", "quorvelctl"},
        {"state", "open"},
        {"recording", platform::URL::fileURLWithPath(file).absoluteString()}};
    for (const auto& [key, value] : expected.items()) EXPECT_EQ(found->at(key), value) << key;
  }
  EXPECT_EQ(quorvelctl({"--json", "sessions", path("Nothing.m4a")}).output, "{\"sessions\":[]}\n");

  auto gaveUp = quorvelctl({"preview", "--wait=0.2", walk});
  EXPECT_EQ(gaveUp.status, 1);
  EXPECT_THAT(gaveUp.output, StartsWith(fmt::format(
                                 "quorvelctl: gave up after 0.2 s waiting for Walk.m4a: held by "
                                 "quorvelctl (pid {}) for capture since ",
                                 capturing.pid())));

  DaemonProcess waiting(DaemonProcess::programPath("quorvelctl"),
                        {"--bus-address", bus_.address(), "preview", "--wait", walk, "--", "sh",
                         "-c", "echo granted >&2"});
  // Refused first (after the one that gave up), then granted once the
  // capture's client is gone.
  ASSERT_TRUE(daemon->waitForLines("Received request to prepare 'Walk.m4a' for preview...", 2))
      << daemon->output();
  capturing.sendSignal(SIGKILL);
  EXPECT_TRUE(waiting.waitForLine("granted")) << waiting.output() << daemon->output();
  EXPECT_EQ(waiting.waitForExit(), 0) << waiting.output();
}

TEST_F(DaemonTest, ForeignClientsGetTheInterfaceAndItsErrors) {
  auto daemon = serve();
  auto introspection = gdbus("introspect");
  ASSERT_EQ(introspection.status, 0) << introspection.output;
  EXPECT_THAT(introspection.output, HasSubstr("interface org.quorvel.SavedRecordingService1"));
  EXPECT_THAT(introspection.output, HasSubstr("PrepareToExport(in  s compositionAVURL,"));
  auto missing =
      gdbus("call", {"--method", "org.quorvel.SavedRecordingService1.PrepareToCapture", ""});
  EXPECT_NE(missing.status, 0);
  EXPECT_THAT(missing.output,
              HasSubstr("org.quorvel.SavedRecordingService.Error.MissingCompositionAVURL"));
  EXPECT_THAT(missing.output, HasSubstr("Code=101"));
  auto dbusSend = [&](std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {"dbus-send", "--bus=" + bus_.address()});
    return DaemonProcess::run(arguments);
  };

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
// join.
TEST_F(DaemonTest, TheSandboxedWorkerRecoversOrphansAndComposesAnExport) {
  useRecordings();
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
  EXPECT_THAT(quorvelctl({"list", "--recordings-dir", recordings_.string()}).output,
              HasSubstr("Found on a card"));

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
  EXPECT_TRUE(RCReadWaveformFile(platform::URL::fileURLWithPath(path("Walk.waveform"))));
}

// A daemon that cannot serve exits at once with its status and says why: 1
// when another serves the name, 2 for a bad option. One with nothing to do
// exits by itself, with status 0.
TEST_F(DaemonTest, RefusesToStartWhenItCannotServeAndExitsByItselfOnceIdle) {
  auto daemon = serve("1");
  const std::string bus = bus_.address();
  const std::string badIdle = "--idle-exit-after: must be a number of seconds, 0 or more";
  for (const auto& [arguments, status, message] :
       {std::tuple{std::vector<std::string>{"--bus-address", bus, "--recordings-dir",
                                            recordings_.string()},
                   1, std::string("quorveld: cannot serve org.quorvel.SavedRecordingService")},
        {{"--bus-address", bus, "--idle-exit-after", "-3"}, 2, badIdle},
        {{"--bus-address", bus, "--idle-exit-after", "soon"}, 2, badIdle}}) {
    DaemonProcess refused(arguments);
    EXPECT_EQ(refused.waitForExit(), status);
    EXPECT_THAT(refused.output(), HasSubstr(message));
  }
  auto info = DaemonProcess::run({DaemonProcess::programPath("quorveld"), "--info"});
  EXPECT_EQ(info.status, 0);
  EXPECT_THAT(info.output, HasSubstr("\"LSEnvironment\": {\"SQLITE_AUTO_TRACE\": \"1\"}"));
  EXPECT_EQ(daemon->waitForExit(), 0) << daemon->output();
  EXPECT_EQ(daemon->linesContaining("[quorveld] Exiting xpc service").size(), 1u);
}

// The daemon reads audio only through its quorvel-media workers.
// The quorvel-media children of `pid`, from every one of its threads.
std::vector<pid_t> workersOf(pid_t pid) {
  std::vector<pid_t> workers;
  for (const auto& task : fs::directory_iterator("/proc/" + std::to_string(pid) + "/task")) {
    std::ifstream list(task.path() / "children");
    for (pid_t child; list >> child;) {
      std::string name;
      std::getline(std::ifstream("/proc/" + std::to_string(child) + "/comm"), name);
      if (name == "quorvel-media") workers.push_back(child);
    }
  }
  return workers;
}

class MediaWorkerDaemonTest : public DaemonTest {
 protected:
  void SetUp() override { useRecordings(); }

  // A recording `name` with fragments of the given lengths, in `format`.
  RCCompositionEditor makeRecording(const std::string& name, const std::string& format,
                                    std::initializer_list<double> seconds) {
    auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
    auto editor = RCCompositionEditor::createCompositionForNewRecording(**model, name, format);
    const std::string source = (temp_ / "source.wav").string();
    for (double length : seconds) {
      EXPECT_TRUE(testing::writeTone(source, length, "wav"));
      EXPECT_TRUE(editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(source)));
    }
    return std::move(*editor);
  }
  // A recording "Walk" whose last capture wrote 0.75 s of audio and crashed
  // before recording its length.
  platform::URL crashedRecording() {
    auto editor = makeRecording("Walk", "wav", {1.0});
    auto captured = editor.beginFragment("wav");
    EXPECT_TRUE(captured && testing::writeTone(captured->path(), 0.75, "wav"));
    return editor.composedAVURL();
  }
  std::optional<double> lastFragmentDuration() {
    auto composition = RCComposition::compositionLoadedFromCompositionBundleURL(
        platform::URL::fileURLWithPath((recordings_ / "Walk.composition").string()));
    if (!composition) return std::nullopt;
    return composition->fragments().back().contentDuration();
  }
};

TEST_F(MediaWorkerDaemonTest, RepairRunsInAWorkerThatDiesWithTheDaemon) {
  platform::URL walk = crashedRecording();
  ASSERT_FALSE(lastFragmentDuration());
  auto daemon = serve();
  auto client = connect();
  auto token = client->prepareToCapture(walk);
  ASSERT_TRUE(token) << token.error() << daemon->output();
  ASSERT_TRUE(daemon->waitForLine("repaired the fragment metadata of Walk.composition"))
      << daemon->output();
  EXPECT_NEAR(lastFragmentDuration().value_or(0), 0.75, 0.01);

  const auto workers = workersOf(daemon->pid());
  ASSERT_EQ(workers.size(), 1u) << daemon->output();
  const int worker = int(::syscall(SYS_pidfd_open, workers[0], 0));
  ASSERT_GE(worker, 0);
  daemon->sendSignal(SIGKILL);
  ASSERT_TRUE(daemon->waitForExit());
  pollfd ended{worker, POLLIN, 0};
  EXPECT_EQ(::poll(&ended, 1, 10000), 1) << "the worker outlived the daemon";
  ::close(worker);
}

TEST_F(MediaWorkerDaemonTest, WithoutItsWorkerTheDaemonStillServesAndSaysWhy) {
  platform::URL walk = crashedRecording();
  const std::string missing = (temp_ / "no-such-worker").string();
  testing::ScopedEnvironment environment{{"QUORVEL_MEDIA_WORKER", missing.c_str()}};
  auto daemon = serve();
  auto client = connect();
  auto token = client->prepareToCapture(walk);
  ASSERT_TRUE(token) << token.error() << daemon->output();
  EXPECT_TRUE(daemon->waitForLine("cannot start the media worker " + missing)) << daemon->output();
  EXPECT_FALSE(lastFragmentDuration());  // nothing it could not read was dropped or changed
  client->endAccessSessionWithToken(*token);
  EXPECT_TRUE(client->prepareToPreview(walk)) << daemon->output();
  EXPECT_TRUE(client->fetchExportingCompositionAVURLs());
}

TEST_F(MediaWorkerDaemonTest, AWorkerOrTheDaemonKilledMidExportLeavesNothingTheNextExportTrips) {
  // Wav into m4a: composing re-encodes, which takes a while.
  const platform::URL audio = makeRecording("Long", "m4a", {30.0, 30.0, 30.0}).composedAVURL();
  auto daemon = serve();
  auto client = connect();
  // Starts an export and, once the composer's temporary output appears,
  // kills `victim`; the export's answer, when it comes.
  auto killMidExport = [&](const std::function<void()>& victim) {
    testing::DirectoryWatch watch(recordings_, IN_CREATE);
    platform::Result<RCSSavedRecordingAccessToken> answer =
        platform::fail(platform::Error("", 0, ""));
    std::thread exporter([&] { answer = client->prepareToExport(audio, false); });
    EXPECT_TRUE(watch.waitForCreation(".Long.m4a"));
    victim();
    exporter.join();
    return answer;
  };
  EXPECT_FALSE(killMidExport([&] {
    for (pid_t worker : workersOf(daemon->pid())) ::kill(worker, SIGKILL);
  }));
  EXPECT_TRUE(daemon->waitForLine("died with SIGKILL")) << daemon->output();
  EXPECT_FALSE(fs::exists(audio.path()));  // no half-written composed file

  // The daemon itself killed mid-compose (its worker dies with it): the
  // next daemon's export composes over what was left, and only the
  // recording's files remain.
  killMidExport([&] {
    daemon->sendSignal(SIGKILL);
    ASSERT_TRUE(daemon->waitForExit());
  });
  EXPECT_FALSE(fs::exists(audio.path()));
  daemon = serve();
  client = connect();
  auto exported = client->prepareToExport(audio, false);
  ASSERT_TRUE(exported) << exported.error() << daemon->output();
  client->endAccessSessionWithToken(*exported);
  EXPECT_TRUE(fs::exists(audio.path()));
  ASSERT_TRUE(RCComposition::load(RCComposition::compositionBundleURLForComposedAVURL(audio)));
  for (const auto& entry : fs::directory_iterator(recordings_))
    EXPECT_NE(entry.path().filename().string().front(), '.') << entry.path();
}

// The recordings directory on a full disk: a small tmpfs mounted in a
// private mount namespace of the test (and so of the daemon and the media
// worker it starts), filled to the last byte. What cannot be written fails
// with an error the caller sees; nothing already there is lost, no temporary
// file stays, and the same request succeeds once there is room again. Needs
// root; skipped otherwise.
class FullDiskTest : public DaemonTest {
 protected:
  // Logged each time the daemon has no work left.
  static constexpr const char* kIdle = "No XPC transactions remain";

  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root to mount a small file system";
    // The namespace is the calling thread's, and so of the processes it
    // starts: the daemon, its media worker, quorvelctl.
    if (::unshare(CLONE_NEWNS) != 0 ||
        ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
      GTEST_SKIP() << "no private mount namespace: " << std::strerror(errno);
    }
    fs::create_directories(disk_);
    if (::mount("quorvel-test", disk_.c_str(), "tmpfs", 0, "size=8m,mode=0700") != 0)
      GTEST_SKIP() << "cannot mount a tmpfs: " << std::strerror(errno);
    mounted_ = true;
    recordings_ = disk_ / "Recordings";
    useRecordings();
    daemon_ = serve();
  }
  void TearDown() override {
    daemon_.reset();
    DaemonTest::TearDown();
    if (mounted_) ::umount2(disk_.c_str(), MNT_DETACH);
  }

  // A tone made outside the disk, so the disk holds only what is tested.
  std::string take(double seconds, double frequency) {
    const std::string file = (temp_ / "take.wav").string();
    EXPECT_TRUE(testing::writeTone(file, seconds, "wav", 44100, 1, frequency));
    return file;
  }
  // Fills the disk to its last byte.
  void fill() {
    const int fd = ::open((disk_ / "filler").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0) << std::strerror(errno);
    const std::string bytes(1 << 16, 'x');
    for (std::size_t chunk = bytes.size(); chunk > 0; chunk /= 2)
      while (::write(fd, bytes.data(), chunk) > 0) {
      }
    ::close(fd);
  }
  void makeRoom() { fs::remove(disk_ / "filler"); }
  // Every file under the recordings directory but the database's and the
  // waveforms (a finalization removes the old one first: it describes the
  // old audio), by path, with its digest; and no temporary file among them.
  std::map<std::string, std::string> contents() const {
    std::map<std::string, std::string> files;
    for (const auto& entry : fs::recursive_directory_iterator(recordings_)) {
      const std::string name = entry.path().filename();
      EXPECT_FALSE(RCIsAtomicReplaceTempName(name)) << entry.path();
      if (!entry.is_regular_file() || name.starts_with(RCSavedRecordingsModel::kDatabaseFileName) ||
          entry.path().extension() == ".waveform") {
        continue;
      }
      auto digest = RCMD5DataForPath(entry.path().string());
      files[fs::relative(entry.path(), recordings_)] = digest ? RCMD5HexString(*digest) : "";
    }
    return files;
  }

  fs::path disk_ = temp_ / "disk";
  bool mounted_ = false;
  std::unique_ptr<DaemonProcess> daemon_;
};

// A recording composed once and then given a second take is exported on a
// full disk: the export fails with the disk's error, the old composed file
// and the fragments stay as they were, and once there is room the export
// composes both takes.
TEST_F(FullDiskTest, AnExportThatCannotBeWrittenFailsAndKeepsTheRecording) {
  auto made = quorvelctl({"new", "--recordings-dir", recordings_.string(), "Walk", take(2.0, 440)});
  ASSERT_EQ(made.status, 0) << made.output;
  const std::string audio = path("Walk.m4a");
  auto exported = quorvelctl({"export", audio, "--", "true"});
  ASSERT_EQ(exported.status, 0) << exported.output << daemon_->output();
  auto editor = RCCompositionEditor::editorForComposedAVURL(platform::URL::fileURLWithPath(audio));
  ASSERT_TRUE(editor) << editor.error();
  auto appended =
      editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(take(20.0, 660)));
  ASSERT_TRUE(appended) << appended.error();
  const auto before = contents();

  ASSERT_NO_FATAL_FAILURE(fill());
  const std::size_t idle = daemon_->linesContaining(kIdle).size();
  auto failed = quorvelctl({"export", audio, "--", "true"});
  EXPECT_NE(failed.status, 0) << failed.output;
  // The reply carries no token (and no error); the daemon logs why.
  EXPECT_THAT(failed.output, HasSubstr("could not be finalized"));
  EXPECT_FALSE(daemon_->linesContaining("No space left on device").empty()) << daemon_->output();
  // quorvelctl leaving while its session still closes makes the daemon try
  // the recording once more, which may still run when the daemon's
  // keep-alives are over: only once it is done is the directory final.
  ASSERT_TRUE(daemon_->waitForLines(kIdle, idle + 1)) << daemon_->output();
  ASSERT_TRUE(daemon_->waitForLines("FINISHED asset finalization",
                                    daemon_->linesContaining("RUNNING asset finalization").size()));
  EXPECT_EQ(contents(), before) << daemon_->output();

  makeRoom();
  auto again = quorvelctl({"export", audio, "--", "true"});
  ASSERT_EQ(again.status, 0) << again.output << daemon_->output();
  auto pcm = testing::decodeToPCM(audio);
  ASSERT_TRUE(pcm) << pcm.error();
  EXPECT_NEAR(pcm->seconds(), 22.0, 0.1);
  contents();  // no temporary file stays
}

// The orphan run on a full disk, over a bundle and a file the database
// lacks, a copy of that file and a file without audio: the database cannot
// take the recovered recordings, so the run stops and deletes nothing; with
// room again the next run recovers them and deletes the copy and the junk.
TEST_F(FullDiskTest, AnOrphanRunThatCannotSaveTheDatabaseDeletesNothing) {
  // The daemon opens (and so makes) the database in a run over the empty
  // directory, and keeps it open; the orphans come once its start-up run
  // is over and orphan handling is off.
  ASSERT_TRUE(daemon_->waitForLines("Keep-alive for orphan handling", 2)) << daemon_->output();
  ASSERT_EQ(quorvelctl({"enable-orphan-handling"}).status, 0);
  ASSERT_EQ(quorvelctl({"disable-orphan-handling"}).status, 0);
  ASSERT_TRUE(testing::writeOrphans(recordings_.string()));
  const auto before = contents();

  ASSERT_NO_FATAL_FAILURE(fill());
  auto enabled = quorvelctl({"enable-orphan-handling"});
  EXPECT_EQ(enabled.status, 0) << enabled.output;
  EXPECT_FALSE(daemon_->linesContaining("cannot save the recordings database").empty())
      << daemon_->output();
  EXPECT_EQ(contents(), before) << daemon_->output();

  makeRoom();
  ASSERT_EQ(quorvelctl({"disable-orphan-handling"}).status, 0);
  ASSERT_EQ(quorvelctl({"enable-orphan-handling"}).status, 0);
  auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
  ASSERT_TRUE(model) << model.error();
  auto lost = (*model)->recordingWithURL(platform::URL::fileURLWithPath(path("Lost.m4a")));
  EXPECT_TRUE(lost && *lost) << daemon_->output();
  EXPECT_NE(fs::exists(path("Found.m4a")), fs::exists(path("Found again.m4a")));
  EXPECT_FALSE(fs::exists(path("Noise.wav")));
}

}  // namespace
}  // namespace quorvel

// The real quorveld reads audio only through its quorvel-media workers: a
// session on a recording left by a crashed capture repairs it through a
// worker, the worker dies with the daemon, a daemon without its worker
// binary still serves every request, and a worker or daemon killed in the
// middle of an export leaves nothing the next export trips over.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <thread>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/service/SavedRecordingServiceClient.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/DirectoryWatch.h"
#include "tests/support/ScopedEnvironment.h"
#include "tests/support/ScopedTempDir.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using testing::DaemonProcess;

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

class MediaWorkerDaemonTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fs::create_directories(recordings_);
    RCSavedRecordingsModel::setSavedRecordingsDirectory(recordings_.string());
  }
  void TearDown() override {
    RCSavedRecordingsModel::resetSharedModelsForTesting();
    RCSavedRecordingsModel::setSavedRecordingsDirectory(std::nullopt);
  }

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
  std::unique_ptr<DaemonProcess> serve() {
    return DaemonProcess::serve(bus_.address(), recordings_.string());
  }
  std::unique_ptr<SavedRecordingServiceClient> connect() {
    auto client = SavedRecordingServiceClient::connect(bus_.address());
    EXPECT_TRUE(client) << client.error();
    return client ? std::move(*client) : nullptr;
  }

  platform::testing::TestBus bus_;
  testing::ScopedTempDir temp_{"qv-worker"};
  fs::path recordings_ = temp_ / "Recordings";
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

}  // namespace
}  // namespace quorvel

// The real quorveld reads audio only through its quorvel-media workers: a
// session on a recording left by a crashed capture repairs it through a
// worker, the worker dies with the daemon, and a daemon without its worker
// binary still serves every request.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/service/SavedRecordingServiceClient.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/TestBus.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using testing::DaemonProcess;

// The children of `pid`, from every one of its threads.
std::vector<pid_t> childrenOf(pid_t pid) {
  std::vector<pid_t> children;
  for (const auto& task : fs::directory_iterator("/proc/" + std::to_string(pid) + "/task")) {
    std::ifstream list(task.path() / "children");
    pid_t child = 0;
    while (list >> child) children.push_back(child);
  }
  return children;
}

std::string commandName(pid_t pid) {
  std::ifstream comm("/proc/" + std::to_string(pid) + "/comm");
  std::string name;
  std::getline(comm, name);
  return name;
}

class MediaWorkerDaemonTest : public ::testing::Test {
 protected:
  void SetUp() override {
    recordings_ = fs::temp_directory_path() /
                  ("quorvel-it-" + std::to_string(getpid()) + "-" +
                   ::testing::UnitTest::GetInstance()->current_test_info()->name());
    fs::remove_all(recordings_);
    fs::create_directories(recordings_);
  }
  void TearDown() override {
    ::unsetenv("QUORVEL_MEDIA_WORKER");
    RCSavedRecordingsModel::resetSharedModelsForTesting();
    RCSavedRecordingsModel::setSavedRecordingsDirectory(std::nullopt);
    fs::remove_all(recordings_);
  }

  // A recording "Walk" whose last capture wrote 0.75 s of audio and crashed
  // before recording its length.
  platform::URL crashedRecording() {
    RCSavedRecordingsModel::setSavedRecordingsDirectory(recordings_.string());
    auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
    EXPECT_TRUE(model);
    auto editor = RCCompositionEditor::createCompositionForNewRecording(**model, "Walk", "wav");
    EXPECT_TRUE(editor);
    std::string source = (recordings_ / "source.wav").string();
    EXPECT_TRUE(testing::writeTone(source, 1.0, "wav"));
    EXPECT_TRUE(editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(source)));
    auto captured = editor->beginFragment("wav");
    EXPECT_TRUE(captured);
    EXPECT_TRUE(testing::writeTone(captured->path(), 0.75, "wav"));
    fs::remove(source);
    bundle_ = RCComposition::compositionBundleURLForComposedAVURL(editor->composedAVURL());
    return editor->composedAVURL();
  }

  std::optional<double> lastFragmentDuration() {
    auto composition = RCComposition::compositionLoadedFromCompositionBundleURL(*bundle_);
    if (!composition) return std::nullopt;
    return composition->fragments().back().contentDuration();
  }

  std::unique_ptr<DaemonProcess> startDaemon() {
    auto daemon = std::make_unique<DaemonProcess>(
        std::vector<std::string>{"--bus-address", bus_.address(), "--recordings-dir",
                                 recordings_.string(), "--idle-exit-after", "0"});
    EXPECT_TRUE(daemon->waitForLine("[BusListener] listening as")) << daemon->output();
    return daemon;
  }

  platform::testing::TestBus bus_;
  fs::path recordings_;
  std::optional<platform::URL> bundle_;
};

TEST_F(MediaWorkerDaemonTest, RepairRunsInAWorkerThatDiesWithTheDaemon) {
  platform::URL walk = crashedRecording();
  ASSERT_FALSE(lastFragmentDuration());
  auto daemon = startDaemon();
  auto client = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(client);
  auto token = (*client)->prepareToCapture(walk);
  ASSERT_TRUE(token) << token.error() << daemon->output();
  ASSERT_TRUE(daemon->waitForLine("repaired the fragment metadata of Walk.composition"))
      << daemon->output();
  std::optional<double> repaired = lastFragmentDuration();
  ASSERT_TRUE(repaired);
  EXPECT_NEAR(*repaired, 0.75, 0.01);

  std::vector<pid_t> workers;
  for (pid_t child : childrenOf(daemon->pid())) {
    if (commandName(child) == "quorvel-media") workers.push_back(child);
  }
  ASSERT_EQ(workers.size(), 1u) << daemon->output();
  int worker = int(::syscall(SYS_pidfd_open, workers[0], 0));
  ASSERT_GE(worker, 0);

  daemon->sendSignal(SIGKILL);
  ASSERT_TRUE(daemon->waitForExit());
  pollfd ended{worker, POLLIN, 0};
  EXPECT_EQ(::poll(&ended, 1, 10000), 1) << "the worker outlived the daemon";
  ::close(worker);
}

TEST_F(MediaWorkerDaemonTest, WithoutItsWorkerTheDaemonStillServesAndSaysWhy) {
  platform::URL walk = crashedRecording();
  ::setenv("QUORVEL_MEDIA_WORKER", (recordings_ / "no-such-worker").c_str(), 1);
  auto daemon = startDaemon();
  auto client = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(client);
  auto token = (*client)->prepareToCapture(walk);
  ASSERT_TRUE(token) << token.error() << daemon->output();
  EXPECT_TRUE(daemon->waitForLine("cannot start the media worker " +
                                  (recordings_ / "no-such-worker").string()))
      << daemon->output();
  // Nothing it could not read was dropped or changed.
  EXPECT_FALSE(lastFragmentDuration());
  (*client)->endAccessSessionWithToken(*token);
  auto again = (*client)->prepareToPreview(walk);
  EXPECT_TRUE(again) << daemon->output();
  auto exporting = (*client)->fetchExportingCompositionAVURLs();
  EXPECT_TRUE(exporting);
}

// Blocks until a file whose name starts with `prefix` is created in the
// directory `watch` was made for.
void waitForCreation(int watch, const std::string& prefix) {
  alignas(inotify_event) char buffer[4096];
  for (;;) {
    ssize_t length = ::read(watch, buffer, sizeof buffer);
    ASSERT_GT(length, 0);
    for (char* at = buffer; at < buffer + length;) {
      auto* event = reinterpret_cast<inotify_event*>(at);
      if (event->len > 0 && std::string(event->name).starts_with(prefix)) return;
      at += sizeof(inotify_event) + event->len;
    }
  }
}

TEST_F(MediaWorkerDaemonTest, AWorkerOrTheDaemonKilledMidExportLeavesNothingTheNextExportTrips) {
  RCSavedRecordingsModel::setSavedRecordingsDirectory(recordings_.string());
  auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
  ASSERT_TRUE(model);
  auto editor = RCCompositionEditor::createCompositionForNewRecording(**model, "Long", "m4a");
  ASSERT_TRUE(editor);
  std::string source = (recordings_ / "source.wav").string();
  ASSERT_TRUE(testing::writeTone(source, 30.0, "wav"));
  for (int i = 0; i < 3; ++i) {  // wav into m4a: composing re-encodes, which takes a while
    ASSERT_TRUE(editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(source)));
  }
  fs::remove(source);
  const platform::URL audio = editor->composedAVURL();
  auto daemon = startDaemon();
  auto client = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(client);

  int watch = inotify_init1(IN_CLOEXEC);
  ASSERT_GE(watch, 0);
  ASSERT_GE(inotify_add_watch(watch, recordings_.c_str(), IN_CREATE), 0);
  platform::Result<RCSSavedRecordingAccessToken> first = platform::fail(platform::Error("", 0, ""));
  std::thread exporter([&] { first = (*client)->prepareToExport(audio, false); });
  waitForCreation(watch, ".Long.m4a");  // the composer's temporary output
  ::close(watch);
  for (pid_t child : childrenOf(daemon->pid())) {
    if (commandName(child) == "quorvel-media") ::kill(child, SIGKILL);
  }
  exporter.join();
  EXPECT_FALSE(first);
  EXPECT_TRUE(daemon->waitForLine("died with SIGKILL")) << daemon->output();
  EXPECT_FALSE(fs::exists(audio.path()));  // no half-written composed file

  // The daemon itself killed mid-compose (its worker dies with it): the
  // next daemon's export composes over what was left, and only the
  // recording's files remain.
  watch = inotify_init1(IN_CLOEXEC);
  ASSERT_GE(inotify_add_watch(watch, recordings_.c_str(), IN_CREATE), 0);
  std::thread abandoned([&] { (void)(*client)->prepareToExport(audio, false); });
  waitForCreation(watch, ".Long.m4a");
  ::close(watch);
  daemon->sendSignal(SIGKILL);
  ASSERT_TRUE(daemon->waitForExit());
  abandoned.join();
  EXPECT_FALSE(fs::exists(audio.path()));
  daemon = startDaemon();
  client = SavedRecordingServiceClient::connect(bus_.address());
  ASSERT_TRUE(client);
  auto second = (*client)->prepareToExport(audio, false);
  ASSERT_TRUE(second) << second.error() << daemon->output();
  (*client)->endAccessSessionWithToken(*second);
  EXPECT_TRUE(fs::exists(audio.path()));
  ASSERT_TRUE(RCComposition::load(RCComposition::compositionBundleURLForComposedAVURL(audio)));
  for (const auto& entry : fs::directory_iterator(recordings_)) {
    EXPECT_NE(entry.path().filename().string().front(), '.') << entry.path();
  }
}

}  // namespace
}  // namespace quorvel

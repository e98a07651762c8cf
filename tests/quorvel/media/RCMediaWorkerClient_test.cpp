// The daemon's media engine against the real quorvel-media worker: every job
// and every kind of error comes back as the in-process engine gives it, and
// the worker's faults (killed, hung, missing) fail one job through the
// composition controller, as the daemon sees them, and nothing more.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/resource.h>
#include <sys/types.h>

#include <atomic>
#include <cmath>
#include <fstream>
#include <future>
#include <mutex>
#include <thread>

#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/MediaWorker.h"
#include "tests/support/RecordingsDirectoryFixture.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using testing::ScopedMediaWorkerEngine;

class MediaWorkerClientTest : public testing::RecordingsDirectoryTest {
 protected:
  void SetUp() override {
    RecordingsDirectoryTest::SetUp();
    auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
    ASSERT_TRUE(model) << model.error();
    model_ = *model;
  }

  static RCMediaWorkerClient::Options options() { return ScopedMediaWorkerEngine::defaults(); }

  platform::URL tone(const std::string& name, const testing::ToneOptions& shape) {
    std::string file = (recordings_ / name).string();
    auto written = testing::writeTone(file, shape);
    EXPECT_TRUE(written) << written.error();
    return platform::URL::fileURLWithPath(file);
  }
  platform::URL tone(const std::string& name, double seconds) {
    testing::ToneOptions shape;
    shape.seconds = seconds;
    shape.format = fs::path(name).extension().string().substr(1);
    return tone(name, shape);
  }

  // A recording "Walk" of two decomposed fragments, made in process.
  platform::URL walk() {
    RCUseInProcessMediaEngine();
    auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, "Walk");
    EXPECT_TRUE(editor);
    EXPECT_TRUE(editor->appendFragmentFromAudioFile(tone("a.m4a", 1.0)));
    EXPECT_TRUE(editor->appendFragmentFromAudioFile(tone("b.m4a", 0.5)));
    return editor->composedAVURL();
  }

  static bool compose(const platform::URL& composed) {
    auto controller = RCCompositionController::compositionControllerForComposedAVURL(composed);
    std::promise<bool> result;
    controller->rcs_composeToFinalDestinationAndDeleteDecomposedFragments(
        false, true, false, [&](bool success) { result.set_value(success); });
    return result.get_future().get();
  }

  static std::size_t decomposedFragments(const platform::URL& composed) {
    return RCCompositionController::compositionControllerForComposedAVURL(composed)
        ->composition()
        ->decomposedFragments()
        .size();
  }

  std::shared_ptr<RCSavedRecordingsModel> model_;
  RCInProcessMediaEngine inProcess_;
};

TEST_F(MediaWorkerClientTest, EveryJobGivesWhatTheInProcessEngineGives) {
  testing::ToneOptions shape;
  shape.seconds = 1.5;
  shape.metadata = {{"title", "Walk"}, {"creation_time", "2020-01-02T03:04:05Z"}};
  platform::URL titled = tone("titled.m4a", shape);
  platform::URL flac = tone("b.flac", 0.5);
  ScopedMediaWorkerEngine worker(options());
  RCMediaEngine& engine = worker.client();

  auto probed = engine.probe(titled);
  auto expected = inProcess_.probe(titled);
  ASSERT_TRUE(probed) << probed.error();
  ASSERT_TRUE(expected);
  EXPECT_TRUE(probed->playable);
  EXPECT_DOUBLE_EQ(probed->duration, expected->duration);
  EXPECT_EQ(probed->containerName, expected->containerName);
  EXPECT_EQ(probed->titleItems, expected->titleItems);
  ASSERT_TRUE(probed->creationDate);
  EXPECT_DOUBLE_EQ(probed->creationDate->timeIntervalSince1970(),
                   expected->creationDate->timeIntervalSince1970());

  // Composing reports progress that only grows, and ends at the whole.
  std::vector<double> fractions;
  platform::URL composed = platform::URL::fileURLWithPath(recordingsPath("Both.wav"));
  platform::URL waveform = RCWaveform::waveformURLForAVURL(composed);
  ASSERT_TRUE(engine.compose({{titled, 0.25, 1.0}, {flac, 0, 0.5}}, composed, waveform,
                             [&](double fraction) { fractions.push_back(fraction); }));
  ASSERT_FALSE(fractions.empty());
  EXPECT_TRUE(std::is_sorted(fractions.begin(), fractions.end()));
  EXPECT_DOUBLE_EQ(fractions.back(), 1.0);
  EXPECT_NEAR(inProcess_.probe(composed)->duration, 1.5, 0.01);
  auto composedWaveform = RCReadWaveformFile(waveform);
  ASSERT_TRUE(composedWaveform) << composedWaveform.error();
  EXPECT_NEAR(composedWaveform->durationSeconds(), 1.5, 0.01);

  // The waveform job writes what the in-process engine writes.
  platform::URL viaWorker = platform::URL::fileURLWithPath(recordingsPath("worker.waveform"));
  platform::URL viaProcess = platform::URL::fileURLWithPath(recordingsPath("process.waveform"));
  fractions.clear();
  ASSERT_TRUE(engine.buildWaveform(titled, viaWorker,
                                   [&](double fraction) { fractions.push_back(fraction); }));
  ASSERT_TRUE(inProcess_.buildWaveform(titled, viaProcess, {}));
  EXPECT_EQ(testing::readFile(viaWorker.path()), testing::readFile(viaProcess.path()));
  ASSERT_FALSE(fractions.empty());
  EXPECT_DOUBLE_EQ(fractions.back(), 1.0);

  ASSERT_TRUE(engine.writeTitle(titled, "Spaziergang", "de"));
  auto retitled = inProcess_.probe(titled);
  ASSERT_TRUE(retitled);
  EXPECT_NE(std::find(retitled->titleItems.begin(), retitled->titleItems.end(),
                      RCMetadataItem{"Spaziergang", "deu"}),
            retitled->titleItems.end());

  // Composing over it keeps its titles and capture date.
  ASSERT_TRUE(engine.compose({{titled, 0.0, 0.5}}, titled, std::nullopt, {}));
  auto recomposed = inProcess_.probe(titled);
  ASSERT_TRUE(recomposed);
  EXPECT_NEAR(recomposed->duration, 0.5, 0.05);
  EXPECT_EQ(recomposed->titleItems, retitled->titleItems);
  EXPECT_EQ(recomposed->creationDate, retitled->creationDate);

  // One job at a time from one thread needs one worker of each lane (the
  // probe's, the long jobs'), reused throughout.
  EXPECT_EQ(worker.client().workerPids().size(), 2u);
}

TEST_F(MediaWorkerClientTest, ErrorsComeBackWithTheirDomainCodeAndMessage) {
  ASSERT_TRUE(testing::writeDamagedAudio(recordings_.string()));
  platform::URL wav = tone("fine.wav", 0.5);
  auto url = [&](const std::string& name) {
    return platform::URL::fileURLWithPath(recordingsPath(name));
  };
  platform::URL out = url("Out.m4a");
  using Job = std::function<platform::Status(RCMediaEngine&)>;
  auto probing = [](platform::URL file) -> Job {
    return [file](RCMediaEngine& engine) -> platform::Status {
      auto probe = engine.probe(file);
      if (!probe) return platform::fail(probe.error());
      if (!probe->playable) return platform::fail(platform::Error("not playable", 0));
      return {};
    };
  };
  std::vector<std::pair<std::string, Job>> jobs = {
      {"probe of a missing file", probing(url("missing.m4a"))},
      {"probe of text", probing(url("text.m4a"))},
      {"probe of a directory", probing(platform::URL::fileURLWithPath(recordings_.string()))},
      {"probe of a video without audio", probing(url("video.m4a"))},
      {"compose with a bad range",
       [&](RCMediaEngine& e) {
         return e.compose({{wav, 0, -1}}, out, std::nullopt, {});
       }},
      {"compose of a truncated file",
       [&](RCMediaEngine& e) {
         return e.compose({{url("cut.wav"), 0, 2}}, out, std::nullopt, {});
       }},
      {"compose into an unknown format",
       [&](RCMediaEngine& e) {
         return e.compose({{wav, 0, 0.5}}, url("Out.xyz"), std::nullopt, {});
       }},
      {"waveform of a missing file",
       [&](RCMediaEngine& e) { return e.buildWaveform(url("missing.wav"), url("w"), {}); }},
      {"waveform into a missing directory",
       [&](RCMediaEngine& e) { return e.buildWaveform(wav, url("no/such/w.waveform"), {}); }},
      {"title into a WAV file", [&](RCMediaEngine& e) { return e.writeTitle(wav, "T", ""); }},
      {"title in a bad language",
       [&](RCMediaEngine& e) { return e.writeTitle(url("video.m4a"), "T", "not a language"); }},
  };
  ScopedMediaWorkerEngine worker(options());
  for (auto& [what, job] : jobs) {
    SCOPED_TRACE(what);
    platform::Status expected = job(inProcess_);
    platform::Status got = job(worker.client());
    ASSERT_FALSE(expected);
    ASSERT_FALSE(got);
    EXPECT_EQ(got.error().domain(), expected.error().domain());
    EXPECT_EQ(got.error().code(), expected.error().code());
    EXPECT_EQ(got.error().localizedDescription(), expected.error().localizedDescription());
  }
  // Errors are answers, not faults: one worker of each lane served every job.
  EXPECT_EQ(worker.client().workerPids().size(), 2u);
  EXPECT_FALSE(fs::exists(out.path()));
}

// Probes have workers of their own: with both long-job workers stopped in
// the middle of a compose, a probe is answered at once, and the composing
// workers run at the lower priority.
TEST_F(MediaWorkerClientTest, AProbeIsAnsweredWhileBothLongJobWorkersAreHeld) {
  platform::URL file = tone("short.wav", 0.5);
  ScopedMediaWorkerEngine worker(options());
  std::mutex mutex;
  std::vector<pid_t> held;  // guarded by mutex
  pid_t prober = 0;         // guarded by mutex
  std::promise<void> bothHeld;
  worker.client().setJobObserverForTesting([&](pid_t pid, RCMediaJobKind kind) {
    std::lock_guard lock(mutex);
    if (kind == RCMediaJobKind::Probe) {
      prober = pid;
      return;
    }
    ::kill(pid, SIGSTOP);
    held.push_back(pid);
    if (held.size() == 2) bothHeld.set_value();
  });
  auto composing = [&](const std::string& name) {
    platform::URL destination = platform::URL::fileURLWithPath(recordingsPath(name));
    return std::async(std::launch::async, [&worker, file, destination] {
      return bool(worker.client().compose({{file, 0, 0.5}}, destination, std::nullopt, {}));
    });
  };
  auto first = composing("One.m4a");
  auto second = composing("Two.m4a");
  bothHeld.get_future().wait();

  auto probe = worker.client().probe(file);
  ASSERT_TRUE(probe) << probe.error();
  EXPECT_TRUE(probe->playable);
  EXPECT_EQ(first.wait_for(std::chrono::seconds(0)), std::future_status::timeout);
  EXPECT_EQ(second.wait_for(std::chrono::seconds(0)), std::future_status::timeout);
  std::lock_guard lock(mutex);
  for (pid_t pid : held) ::kill(pid, SIGCONT);
  EXPECT_TRUE(first.get());
  EXPECT_TRUE(second.get());
  // A worker lowers its priority when it starts, which a stopped one had not
  // yet done; they stay alive, idle, after their jobs.
  const int own = ::getpriority(PRIO_PROCESS, 0);
  EXPECT_EQ(::getpriority(PRIO_PROCESS, prober), own);
  for (pid_t pid : held) EXPECT_EQ(::getpriority(PRIO_PROCESS, pid), std::min(own + 10, 19));
}

// A batch answers each file as probing it alone does, in order, over
// several requests; when its worker is killed, the files it had not
// answered are probed one by one, so every good file still has its answer.
TEST_F(MediaWorkerClientTest, ABatchAnswersEachFileInOrderWhateverHappensToItsWorker) {
  ASSERT_TRUE(testing::writeDamagedAudio(recordings_.string()));
  testing::ToneOptions titled;
  titled.metadata = {{"title", "Walk"}};
  const std::vector<platform::URL> kinds = {
      tone("titled.m4a", titled),
      platform::URL::fileURLWithPath(recordingsPath("missing.m4a")),
      platform::URL::fileURLWithPath(recordingsPath("text.m4a")),
      tone("fine.wav", 0.3),
      platform::URL::fileURLWithPath(recordingsPath("video.m4a")),
      platform::URL::fileURLWithPath(recordings_.string()),
  };
  std::vector<platform::URL> files;  // more than two requests' worth
  for (std::size_t i = 0; i < 2 * kRCMediaMaxProbeBatch + 3; ++i) {
    files.push_back(kinds[i % kinds.size()]);
  }
  struct Case {
    std::string name;
    int killAtCall;  // of the observer for the first batch: 1 sent, 2 first answer; 0 never
  };
  for (const Case& row : std::vector<Case>{{"undisturbed", 0},
                                           {"killed before answering", 1},
                                           {"killed after its first answer", 2}}) {
    SCOPED_TRACE(row.name);
    ScopedMediaWorkerEngine worker(options());
    std::atomic<int> batchCalls = 0, singles = 0;
    worker.client().setJobObserverForTesting([&](pid_t pid, RCMediaJobKind kind) {
      if (kind == RCMediaJobKind::Probe) ++singles;
      if (kind != RCMediaJobKind::ProbeMany) return;
      if (++batchCalls == row.killAtCall) ::kill(pid, SIGKILL);
    });
    auto probes = worker.client().probeMany(files);

    ASSERT_EQ(probes.size(), files.size());
    for (std::size_t i = 0; i < files.size(); ++i) {
      SCOPED_TRACE(files[i].lastPathComponent() + " at " + std::to_string(i));
      auto expected = inProcess_.probe(files[i]);
      ASSERT_EQ(bool(probes[i]), bool(expected));
      if (expected) {
        EXPECT_EQ(probes[i]->playable, expected->playable);
        if (!std::isnan(expected->duration)) {
          EXPECT_DOUBLE_EQ(probes[i]->duration, expected->duration);
        }
        EXPECT_EQ(std::isnan(probes[i]->duration), std::isnan(expected->duration));
        EXPECT_EQ(probes[i]->titleItems, expected->titleItems);
      } else {
        EXPECT_EQ(probes[i].error(), expected.error());
        EXPECT_EQ(probes[i].error().localizedDescription(),
                  expected.error().localizedDescription());
      }
    }
    // Undisturbed, every file went in a batch; killed, the rest went alone.
    if (row.killAtCall == 0) {
      EXPECT_EQ(singles.load(), 0);
    } else {
      EXPECT_GT(singles.load(), 0);
    }
  }
}

TEST_F(MediaWorkerClientTest, AWorkerKilledMidComposeFailsThatJobOnlyAndLeavesNoTemporaryFile) {
  platform::URL composed = walk();
  ScopedMediaWorkerEngine worker(options());
  std::atomic<pid_t> killed = 0;
  worker.client().setJobObserverForTesting([&](pid_t pid, RCMediaJobKind kind) {
    pid_t none = 0;
    if (kind == RCMediaJobKind::Compose && killed.compare_exchange_strong(none, pid)) {
      ::kill(pid, SIGKILL);
    }
  });

  EXPECT_FALSE(compose(composed));
  EXPECT_TRUE(logged("quorvel-media died with SIGKILL while composing Walk.m4a"));
  EXPECT_EQ(decomposedFragments(composed), 2u);
  EXPECT_FALSE(fs::exists(composed.path()));

  // What a worker killed while writing leaves behind goes with the next compose.
  const std::string leftover = RCAtomicReplaceTempName("Walk.m4a");
  const std::string waveformLeftover = RCAtomicReplaceTempName("Walk.waveform");
  testing::writeFile(recordings_ / leftover, "half a file");
  testing::writeFile(recordings_ / waveformLeftover, "half a waveform");
  ASSERT_TRUE(compose(composed));
  EXPECT_FALSE(fs::exists(recordings_ / leftover));
  EXPECT_FALSE(fs::exists(recordings_ / waveformLeftover));
  EXPECT_EQ(decomposedFragments(composed), 0u);
  EXPECT_NEAR(inProcess_.probe(composed)->duration, 1.5, 0.06);
  // A fresh worker did it.
  ASSERT_EQ(worker.client().workerPids().size(), 1u);
  EXPECT_NE(worker.client().workerPids()[0], killed.load());
}

TEST_F(MediaWorkerClientTest, AJobWithoutProgressIsKilledAfterTheTimeout) {
  platform::URL composed = walk();
  auto configured = options();
  configured.noProgressTimeout = std::chrono::milliseconds(200);
  ScopedMediaWorkerEngine worker(configured);
  std::atomic<pid_t> stopped = 0;
  worker.client().setJobObserverForTesting([&](pid_t pid, RCMediaJobKind kind) {
    // A stopped worker is a hung one: it neither answers nor reports progress.
    pid_t none = 0;
    if (kind == RCMediaJobKind::Compose && stopped.compare_exchange_strong(none, pid)) {
      ::kill(pid, SIGSTOP);
    }
  });

  EXPECT_FALSE(compose(composed));
  EXPECT_TRUE(
      logged("quorvel-media made no progress for 0.2 s while composing Walk.m4a; it was killed"));
  EXPECT_EQ(decomposedFragments(composed), 2u);
  EXPECT_TRUE(worker.client().workerPids().empty());
  // The recording composes once the media work runs again (with the usual
  // timeout: a loaded machine may take longer to start a worker than this
  // test's).
  ScopedMediaWorkerEngine healthy(options());
  ASSERT_TRUE(compose(composed));
  EXPECT_EQ(decomposedFragments(composed), 0u);
}

TEST_F(MediaWorkerClientTest, AMissingWorkerFailsEveryMediaJobAndNothingElse) {
  platform::URL composed = walk();
  auto configured = options();
  configured.workerPath = path("no-such-quorvel-media");
  ScopedMediaWorkerEngine worker(configured);

  EXPECT_FALSE(compose(composed));
  EXPECT_TRUE(logged("cannot start the media worker " + path("no-such-quorvel-media") +
                     ": No such file or directory"));
  EXPECT_EQ(RCAudioAsset::assetWithURL(platform::URL::fileURLWithPath(recordingsPath("a.m4a"))),
            nullptr);
  auto metadata = RCAudioAsset(platform::URL::fileURLWithPath(recordingsPath("a.m4a")), 1, "mov")
                      .loadCommonMetadata();
  ASSERT_FALSE(metadata);
  EXPECT_EQ(metadata.error(), RCMediaError(RCMediaErrorCodeWorkerFailed, ""));
  EXPECT_TRUE(worker.client().workerPids().empty());
}

TEST_F(MediaWorkerClientTest, ManyThreadsShareTwoWorkersAndJobsCrossingAnIdleExitAreRetried) {
  platform::URL file = tone("short.wav", 0.2);
  auto configured = options();
  // Workers exit as soon as they are idle, so requests keep meeting exits.
  configured.idleExitAfter = std::chrono::duration<double>(0);
  ScopedMediaWorkerEngine worker(configured);
  std::atomic<std::size_t> mostWorkers = 0;
  worker.client().setJobObserverForTesting([&](pid_t, RCMediaJobKind) {
    std::size_t now = worker.client().workerPids().size();
    std::size_t seen = mostWorkers.load();
    while (now > seen && !mostWorkers.compare_exchange_weak(seen, now)) {
    }
  });
  std::atomic<int> failures = 0;
  std::vector<std::thread> threads;
  for (int t = 0; t < 6; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 8; ++i) {
        auto probe = worker.client().probe(file);
        if (!probe || !probe->playable) ++failures;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
  EXPECT_LE(mostWorkers.load(), 2u);
  EXPECT_GE(mostWorkers.load(), 1u);
}

// Stand-ins for a broken or compromised worker, as shell scripts on the
// worker's socket (descriptor 3): whatever they send, the job fails with
// what went wrong and the stand-in is ended.
TEST_F(MediaWorkerClientTest, AWorkerThatBreaksTheProtocolFailsItsJobWithWhatItDid) {
  platform::URL file = tone("short.wav", 0.2);
  auto fake = [&](const std::string& name, const std::string& script) {
    std::string program = path(name);
    testing::writeFile(program, "#!/bin/sh\n" + script + "\n");
    fs::permissions(program, fs::perms::owner_all);
    auto configured = options();
    configured.workerPath = program;
    return configured;
  };
  struct Case {
    std::string name, script, error;
  };
  std::vector<Case> cases = {
      // A frame of 2 GiB is refused from its header alone.
      {"huge", R"(printf '\000\000\000\200' >&3; exec cat <&3 >/dev/null)",
       "quorvel-media broke the protocol while probing short.wav: a frame of 2147483648 bytes "
       "exceeds the limit"},
      {"foreign", R"(printf '\024\000\000\000{"id":9,"result":{}}' >&3; exec cat <&3 >/dev/null)",
       "quorvel-media broke the protocol while probing short.wav: a reply to another request"},
      {"garbage", R"(printf '\004\000\000\000{]}x' >&3; exec cat <&3 >/dev/null)",
       "quorvel-media broke the protocol while probing short.wav: malformed reply"},
      {"crashing", "exit 3", "quorvel-media exited with status 3 while probing short.wav"},
      // Exiting as an idle worker does is retried, but not for ever.
      {"quitting", "exit 0", "quorvel-media exited with status 0 while probing short.wav"},
  };
  for (const Case& broken : cases) {
    SCOPED_TRACE(broken.name);
    RCMediaWorkerClient client(fake(broken.name, broken.script));
    auto probe = client.probe(file);
    ASSERT_FALSE(probe);
    EXPECT_EQ(probe.error(), RCMediaError(RCMediaErrorCodeWorkerFailed, ""));
    EXPECT_TRUE(probe.error().localizedDescription().starts_with(broken.error))
        << probe.error().localizedDescription();
    EXPECT_TRUE(client.workerPids().empty());
  }
}

// The worker's FFmpeg opens only the containers recordings use: a valid
// audio file of another format, which an app reads, is refused there.
TEST_F(MediaWorkerClientTest, TheWorkerOpensOnlyTheFormatsRecordingsUse) {
  // A Sun audio file: 24-byte big-endian header, then 0.1 s of 16-bit PCM.
  auto be32 = [](std::uint32_t value) {
    return std::string{char(value >> 24), char(value >> 16), char(value >> 8), char(value)};
  };
  const std::uint32_t bytes = 1600;
  std::string au = ".snd" + be32(24) + be32(bytes) + be32(3) + be32(8000) + be32(1);
  au += std::string(bytes, '\0');
  testing::writeFile(recordingsPath("sun.au"), au);
  platform::URL file = platform::URL::fileURLWithPath(recordingsPath("sun.au"));

  auto inProcess = inProcess_.probe(file);
  ASSERT_TRUE(inProcess) << inProcess.error();
  EXPECT_TRUE(inProcess->playable);
  ScopedMediaWorkerEngine worker(options());
  auto confined = worker.client().probe(file);
  ASSERT_FALSE(confined);
  EXPECT_EQ(confined.error().domain(), kRCAudioAssetErrorDomain);
  // The allowed formats still open there.
  auto wav = worker.client().probe(tone("fine.wav", 0.1));
  ASSERT_TRUE(wav) << wav.error();
  EXPECT_TRUE(wav->playable);
}

}  // namespace
}  // namespace quorvel

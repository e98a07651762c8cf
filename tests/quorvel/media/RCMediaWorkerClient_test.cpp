// The daemon's media engine against the real quorvel-media worker: every job
// and every kind of error comes back as the in-process engine gives it, and
// the worker's faults (killed, hung, missing, broken) fail one job, as the
// composition controller sees them, and nothing more.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>

#include <atomic>
#include <cmath>
#include <future>
#include <mutex>
#include <optional>
#include <thread>

#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFile.h"
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
  platform::URL file(const std::string& name) const {
    return platform::URL::fileURLWithPath(recordingsPath(name));
  }
  platform::URL tone(const std::string& name, double seconds, testing::ToneOptions shape = {}) {
    shape.seconds = seconds;
    shape.format = fs::path(name).extension().string().substr(1);
    EXPECT_TRUE(testing::writeTone(recordingsPath(name), shape));
    return file(name);
  }
  static testing::ToneOptions titled() {
    return {.metadata = {{"title", "Walk"}, {"creation_time", "2020-01-02T03:04:05Z"}}};
  }

  RCInProcessMediaEngine inProcess_;
};

void expectSameProbe(const platform::Result<RCMediaProbe>& got,
                     const platform::Result<RCMediaProbe>& expected) {
  ASSERT_EQ(bool(got), bool(expected));
  if (!expected) {
    EXPECT_EQ(got.error(), expected.error());
    EXPECT_EQ(got.error().localizedDescription(), expected.error().localizedDescription());
    return;
  }
  auto shape = [](const RCMediaProbe& p) {
    return std::tuple(p.playable, std::isnan(p.duration) ? -1.0 : p.duration, p.containerName,
                      p.titleItems, p.creationDate);
  };
  EXPECT_EQ(shape(*got), shape(*expected));
}

TEST_F(MediaWorkerClientTest, EveryJobAndEveryErrorComeBackAsTheInProcessEngineGivesThem) {
  ASSERT_TRUE(testing::writeDamagedAudio(recordings_.string()));
  platform::URL titledFile = tone("titled.m4a", 1.5, titled()), flac = tone("b.flac", 0.5);
  platform::URL wav = tone("fine.wav", 0.5), out = file("Out.m4a");
  ScopedMediaWorkerEngine worker;
  RCMediaEngine& engine = worker.client();

  // Progress only grows, and ends at the whole.
  std::vector<double> fractions;
  auto progress = [&](double fraction) { fractions.push_back(fraction); };
  platform::URL composed = file("Both.wav"), waveform = RCWaveform::waveformURLForAVURL(composed);
  ASSERT_TRUE(
      engine.compose({{titledFile, 0.25, 1.0}, {flac, 0, 0.5}}, composed, waveform, progress));
  ASSERT_FALSE(fractions.empty());
  EXPECT_TRUE(std::ranges::is_sorted(fractions));
  EXPECT_DOUBLE_EQ(fractions.back(), 1.0);
  EXPECT_NEAR(inProcess_.probe(composed)->duration, 1.5, 0.01);
  auto composedWaveform = RCReadWaveformFile(waveform);
  ASSERT_TRUE(composedWaveform) << composedWaveform.error();
  EXPECT_NEAR(composedWaveform->durationSeconds(), 1.5, 0.01);

  fractions.clear();
  ASSERT_TRUE(engine.buildWaveform(titledFile, file("worker.waveform"), progress));
  ASSERT_TRUE(inProcess_.buildWaveform(titledFile, file("process.waveform"), {}));
  EXPECT_EQ(testing::readFile(recordingsPath("worker.waveform")),
            testing::readFile(recordingsPath("process.waveform")));
  ASSERT_FALSE(fractions.empty());
  EXPECT_DOUBLE_EQ(fractions.back(), 1.0);

  ASSERT_TRUE(engine.writeTitle(titledFile, "Spaziergang", "de"));
  auto retitled = inProcess_.probe(titledFile);
  ASSERT_TRUE(retitled);
  EXPECT_TRUE(std::ranges::count(retitled->titleItems, RCMetadataItem{"Spaziergang", "deu"}));
  // Composing over it keeps its titles and capture date.
  ASSERT_TRUE(engine.compose({{titledFile, 0.0, 0.5}}, titledFile, std::nullopt, {}));
  auto recomposed = engine.probe(titledFile);
  ASSERT_TRUE(recomposed);
  EXPECT_NEAR(recomposed->duration, 0.5, 0.05);
  EXPECT_EQ(recomposed->titleItems, retitled->titleItems);
  EXPECT_EQ(recomposed->creationDate, retitled->creationDate);

  auto composing = [&](std::vector<RCComposerSegment> segments, platform::URL to) {
    return [=](RCMediaEngine& e) { return e.compose(segments, to, std::nullopt, {}); };
  };
  using Job = std::function<platform::Status(RCMediaEngine&)>;
  // clang-format off
  for (const auto& [what, job] : std::vector<std::pair<const char*, Job>>{
           {"bad range", composing({{wav, 0, -1}}, out)},
           {"truncated file", composing({{file("cut.wav"), 0, 2}}, out)},
           {"unknown format", composing({{wav, 0, 0.5}}, file("O.xyz"))},
           {"waveform of nothing", [&](auto& e) { return e.buildWaveform(file("none.wav"), file("w"), {}); }},
           {"waveform nowhere", [&](auto& e) { return e.buildWaveform(wav, file("no/w.waveform"), {}); }},
           {"title into WAV", [&](auto& e) { return e.writeTitle(wav, "T", ""); }},
           {"bad language", [&](auto& e) { return e.writeTitle(file("video.m4a"), "T", "not a language"); }},
       }) {
    // clang-format on
    SCOPED_TRACE(what);
    platform::Status expected = job(inProcess_), got = job(engine);
    ASSERT_FALSE(expected);
    ASSERT_FALSE(got);
    EXPECT_EQ(got.error(), expected.error());
    EXPECT_EQ(got.error().localizedDescription(), expected.error().localizedDescription());
  }
  // Errors are answers, not faults: one worker of each lane (the probe's, the
  // long jobs') served every job.
  EXPECT_EQ(worker.client().workerPids().size(), 2u);
  EXPECT_FALSE(fs::exists(out.path()));
}

// A batch answers each file as probing it alone does, in order, over several
// requests; when its worker is killed, the files it had not answered are
// probed one by one, so every good file still has its answer.
TEST_F(MediaWorkerClientTest, ABatchAnswersEachFileInOrderWhateverHappensToItsWorker) {
  ASSERT_TRUE(testing::writeDamagedAudio(recordings_.string()));
  const std::vector<platform::URL> kinds = {tone("titled.m4a", 1, titled()),
                                            file("missing.m4a"),
                                            file("text.m4a"),
                                            tone("fine.wav", 0.3),
                                            file("video.m4a"),
                                            file("cut.wav"),
                                            platform::URL::fileURLWithPath(recordings_.string())};
  std::vector<platform::URL> files;  // more than two requests' worth
  for (std::size_t i = 0; i < 2 * kRCMediaMaxProbeBatch + 3; ++i)
    files.push_back(kinds[i % kinds.size()]);
  // Of the observer's calls for the first batch: 1 sent, 2 first answer; 0 never.
  for (int killAtCall : {0, 1, 2}) {
    SCOPED_TRACE(killAtCall);
    ScopedMediaWorkerEngine worker;
    std::atomic<int> batchCalls = 0, singles = 0;
    worker.client().setJobObserverForTesting([&](pid_t pid, RCMediaJobKind kind) {
      if (kind == RCMediaJobKind::Probe) ++singles;
      if (kind == RCMediaJobKind::ProbeMany && ++batchCalls == killAtCall) ::kill(pid, SIGKILL);
    });
    auto probes = worker.client().probeMany(files);
    ASSERT_EQ(probes.size(), files.size());
    for (std::size_t i = 0; i < files.size(); ++i) {
      SCOPED_TRACE(files[i].lastPathComponent() + " at " + std::to_string(i));
      expectSameProbe(probes[i], inProcess_.probe(files[i]));
    }
    // Undisturbed, every file went in a batch; killed, the rest went alone.
    EXPECT_EQ(singles.load() > 0, killAtCall != 0);
  }
}

// Probes have workers of their own: with both long-job workers stopped in
// the middle of a compose, a probe is answered at once; the composing
// workers run at the lower priority.
TEST_F(MediaWorkerClientTest, AProbeIsAnsweredWhileBothLongJobWorkersAreHeld) {
  platform::URL audio = tone("short.wav", 0.5);
  ScopedMediaWorkerEngine worker;
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
    return std::async(std::launch::async, [&worker, audio, destination = file(name)] {
      return bool(worker.client().compose({{audio, 0, 0.5}}, destination, std::nullopt, {}));
    });
  };
  auto first = composing("One.m4a"), second = composing("Two.m4a");
  bothHeld.get_future().wait();

  auto probe = worker.client().probe(audio);
  EXPECT_TRUE(probe && probe->playable);
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

// A hung, missing, broken or killed worker (stand-ins as shell scripts on the
// worker's socket, descriptor 3) fails the compose of the recording with what
// went wrong, is ended, and leaves the fragments as they were; the client
// whose worker was killed then composes it, sweeping what that worker left.
TEST_F(MediaWorkerClientTest, AFaultyWorkerFailsTheComposeWithWhatWentWrongAndNothingElse) {
  auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
  ASSERT_TRUE(model) << model.error();
  auto editor = RCCompositionEditor::createCompositionForNewRecording(**model, "Walk");
  ASSERT_TRUE(editor);
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("a.m4a", 1.0)));
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("b.m4a", 0.5)));
  auto controller =
      RCCompositionController::compositionControllerForComposedAVURL(editor->composedAVURL());
  struct Case {
    const char* name;
    const char* script;  // none: the real worker; empty: no worker at all
    int signal;          // sent to the real worker as it starts its first compose
    std::string error;
  };
  const std::string composing = " while composing Walk.m4a";
  const std::string broke = "quorvel-media broke the protocol" + composing + ": ";
  std::optional<ScopedMediaWorkerEngine> worker;
  for (const Case& c : std::vector<Case>{
           // A stopped worker is a hung one: it neither answers nor reports progress.
           {"hung", nullptr, SIGSTOP,
            "quorvel-media made no progress for 0.2 s" + composing + "; it was killed"},
           {"missing", "", 0,
            "cannot start the media worker " + path("missing") + ": No such file or directory"},
           // A frame of 2 GiB is refused from its header alone.
           {"huge", R"(printf '\000\000\000\200' >&3; exec cat <&3 >/dev/null)", 0,
            broke + "a frame of 2147483648 bytes exceeds the limit"},
           {"foreign",
            R"(printf '\024\000\000\000{"id":9,"result":{}}' >&3; exec cat <&3 >/dev/null)", 0,
            broke + "a reply to another request"},
           {"garbage", R"(printf '\004\000\000\000{]}x' >&3; exec cat <&3 >/dev/null)", 0,
            broke + "malformed reply"},
           {"crashing", "exit 3", 0, "quorvel-media exited with status 3" + composing},
           // Exiting as an idle worker does is retried, but not for ever.
           {"quitting", "exit 0", 0, "quorvel-media exited with status 0" + composing},
           {"killed", nullptr, SIGKILL, "quorvel-media died with SIGKILL" + composing},
       }) {
    SCOPED_TRACE(c.name);
    auto options = ScopedMediaWorkerEngine::defaults();
    // The usual timeout elsewhere: a loaded machine may take longer than this
    // to start a worker.
    if (c.signal == SIGSTOP) options.noProgressTimeout = std::chrono::milliseconds(200);
    if (c.script) options.workerPath = path(c.name);
    if (c.script && *c.script) {
      testing::writeFile(options.workerPath, "#!/bin/sh\n" + std::string(c.script) + "\n");
      fs::permissions(options.workerPath, fs::perms::owner_all);
    }
    worker.emplace(options);
    worker->client().setJobObserverForTesting(
        [signal = c.signal, once = std::make_shared<std::once_flag>()](pid_t pid, auto kind) {
          if (kind == RCMediaJobKind::Compose && signal)
            std::call_once(*once, [&] { ::kill(pid, signal); });
        });
    auto composed = controller->composeNow(false, true);
    ASSERT_FALSE(composed);
    EXPECT_EQ(composed.error(), RCMediaError(RCMediaErrorCodeWorkerFailed, ""));
    EXPECT_TRUE(composed.error().localizedDescription().starts_with(c.error))
        << composed.error().localizedDescription();
    // Without a working worker, every job fails: a probe too.
    if (c.script) {
      auto probe = worker->client().probe(file("a.m4a"));
      EXPECT_TRUE(!probe && probe.error() == RCMediaError(RCMediaErrorCodeWorkerFailed, ""));
    }
    EXPECT_TRUE(worker->client().workerPids().empty());
    EXPECT_EQ(controller->composition()->decomposedFragments().size(), 2u);
    EXPECT_FALSE(fs::exists(editor->composedAVURL().path()));
  }
  const std::string leftovers[] = {RCAtomicReplaceTempName("Walk.m4a"),
                                   RCAtomicReplaceTempName("Walk.waveform")};
  for (const auto& leftover : leftovers) testing::writeFile(recordings_ / leftover, "half");
  ASSERT_TRUE(controller->composeNow(false, true));
  for (const auto& leftover : leftovers) EXPECT_FALSE(fs::exists(recordings_ / leftover));
  EXPECT_TRUE(controller->composition()->decomposedFragments().empty());
  EXPECT_NEAR(inProcess_.probe(editor->composedAVURL())->duration, 1.5, 0.06);
  EXPECT_EQ(worker->client().workerPids().size(), 1u);  // a fresh one
}

TEST_F(MediaWorkerClientTest, ManyThreadsShareTwoWorkersAndJobsCrossingAnIdleExitAreRetried) {
  platform::URL audio = tone("short.wav", 0.2);
  auto options = ScopedMediaWorkerEngine::defaults();
  // Workers exit as soon as they are idle, so requests keep meeting exits.
  options.idleExitAfter = std::chrono::duration<double>(0);
  ScopedMediaWorkerEngine worker(options);
  std::atomic<std::size_t> mostWorkers = 0;
  worker.client().setJobObserverForTesting([&](pid_t, RCMediaJobKind) {
    std::size_t now = worker.client().workerPids().size(), seen = mostWorkers.load();
    while (now > seen && !mostWorkers.compare_exchange_weak(seen, now)) {
    }
  });
  std::atomic<int> failures = 0;
  std::vector<std::jthread> threads;
  for (int t = 0; t < 6; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 8; ++i) {
        auto probe = worker.client().probe(audio);
        if (!probe || !probe->playable) ++failures;
      }
    });
  }
  threads.clear();
  EXPECT_EQ(failures.load(), 0);
  EXPECT_LE(mostWorkers.load(), 2u);
  EXPECT_GE(mostWorkers.load(), 1u);
}

// The worker's FFmpeg opens only the containers recordings use: a valid
// audio file of another format, which an app reads, is refused there.
TEST_F(MediaWorkerClientTest, TheWorkerOpensOnlyTheFormatsRecordingsUse) {
  // A Sun audio file: 24-byte big-endian header, then 0.1 s of 16-bit PCM.
  std::string au = ".snd";
  for (std::uint32_t word : {24u, 1600u, 3u, 8000u, 1u})
    for (int shift = 24; shift >= 0; shift -= 8) au += char(word >> shift);
  testing::writeFile(recordingsPath("sun.au"), au + std::string(1600, '\0'));
  auto inProcess = inProcess_.probe(file("sun.au"));
  ASSERT_TRUE(inProcess) << inProcess.error();
  EXPECT_TRUE(inProcess->playable);
  ScopedMediaWorkerEngine worker;
  auto confined = worker.client().probe(file("sun.au"));
  ASSERT_FALSE(confined);
  EXPECT_EQ(confined.error().domain(), kRCAudioAssetErrorDomain);
}

}  // namespace
}  // namespace quorvel

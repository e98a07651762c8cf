// Finalization through the service core on real recordings: an export that
// composes and caches the waveform first, a recording left by a vanished
// capture client, the background finalization after a capture, a bundle
// that does not load, and fragments whose files are damaged.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "tests/quorveld/ServiceFixture.h"
#include "tests/support/DelegatingMediaEngine.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

constexpr const char* kChanged = "ExportingCompositionAVURLsChanged";

class FinalizationTest : public SessionTest {
 protected:
  std::size_t decomposed(const RCCompositionEditor& editor) {
    auto composition =
        RCComposition::compositionLoadedFromCompositionBundleURL(editor.composition()->bundleURL());
    return composition ? composition->decomposedFragments().size() : 999;
  }
  std::size_t changeSignals() {
    std::size_t count = 0;
    for (const auto& [name, arguments] : listener_->emittedSignals()) count += name == kChanged;
    return count;
  }
  bool exists(const platform::URL& url) { return std::filesystem::exists(url.path()); }
  RCCompositionManifest manifestOf(const RCCompositionEditor& editor) {
    auto loaded = RCComposition::load(editor.composition()->bundleURL());
    EXPECT_TRUE(loaded) << loaded.error();
    return loaded ? (*loaded)->manifest() : RCCompositionManifest{};
  }
  double composedSeconds(const RCCompositionEditor& editor) {
    auto asset = RCAudioAsset::assetWithURL(editor.composedAVURL());
    return asset ? asset->duration() : -1;
  }
  // Overwrites the file's header with bytes no media file starts with, as
  // a failing disk or a stray write would, keeping its size.
  static void damage(const std::string& path) {
    std::fstream file(path, std::ios::binary | std::ios::in | std::ios::out);
    file << std::string(64, '\x5a');
  }
  std::size_t linesAt(int level, std::string_view text) {
    auto all = lines();
    return std::size_t(std::ranges::count_if(all, [&](const LogLine& line) {
      return line.level == level && line.text.find(text) != std::string::npos;
    }));
  }
  // Entries of the recordings waiting for a later close to be finalized.
  std::size_t waitingFinalizations() {
    return onServiceQueue<std::size_t>(
        [&] { return service_->compositionAVURLsToFinalizeForTesting().size(); });
  }
};

TEST_F(FinalizationTest, AnExportAnswersOnceItsRecordingIsComposedWithItsWaveform) {
  auto editor = makeRecording("Walk", {0.3, 0.2});
  ASSERT_TRUE(editor);
  const platform::URL audio = editor->composedAVURL();
  const std::string name = audio.lastPathComponent();
  // Held back, so the exporting set can be seen while the work is pending.
  service_->assetExportController().setMaxConcurrentOperationCountForTesting(0);
  auto exported = call(":1.1", "PrepareToExport", {url(name), true});
  auto second = call(":1.2", "PrepareToExport", {url(name), false});
  for (int i = 0; i < 12; ++i) drainServiceQueue();
  auto during = call(":1.3", "FetchExportingCompositionAVURLs");
  ASSERT_TRUE(during->waitFor(10s));
  EXPECT_EQ(during->values().at(0).asStringArray(), std::vector<std::string>{url(name)});
  EXPECT_EQ(service_->assetExportController().pendingOperationCountForTesting(), 2u);

  service_->assetExportController().setMaxConcurrentOperationCountForTesting(2);
  advance(0s);
  EXPECT_EQ(token(exported).fields().at(1).asInt32(), 1);
  EXPECT_EQ(token(second).fields().at(1).asInt32(), 1);
  EXPECT_EQ(decomposed(*editor), 0u);
  EXPECT_TRUE(exists(audio));
  EXPECT_TRUE(exists(RCWaveform::waveformURLForAVURL(audio)));
  EXPECT_EQ(changeSignals(), 4u);  // handed over and answered, for each request
  auto after = call(":1.3", "FetchExportingCompositionAVURLs");
  ASSERT_TRUE(after->waitFor(10s));
  EXPECT_TRUE(after->values().at(0).asStringArray().empty());
}

TEST_F(FinalizationTest, AVanishedCaptureClientLeavesItsRecordingFinalized) {
  auto editor = makeRecording("Interview", {0.2});
  ASSERT_TRUE(editor);
  const platform::URL audio = editor->composedAVURL();
  token(prepare(":1.1", "PrepareToCapture", audio.lastPathComponent()));
  listener_->vanish(":1.1");
  settle();
  EXPECT_EQ(openSessions(), 0u);
  EXPECT_EQ(decomposed(*editor), 0u);
  EXPECT_TRUE(exists(RCWaveform::waveformURLForAVURL(audio)));
  EXPECT_EQ(linesContaining("Finally closing access session").size(), 0u);
}

TEST_F(FinalizationTest, ACaptureEndedNormallyIsFinalizedInTheBackground) {
  auto editor = makeRecording("Lecture", {0.2});
  ASSERT_TRUE(editor);
  const std::string name = editor->composedAVURL().lastPathComponent();
  end(":1.1", token(prepare(":1.1", "PrepareToCapture", name)));
  settle();
  EXPECT_EQ(
      linesContaining("Received request to schedule finalization of '" + name + "'...").size(), 1u);
  EXPECT_EQ(decomposed(*editor), 0u);
  EXPECT_EQ(openSessions(), 0u);
  // A preview is shared, so its end schedules nothing.
  end(":1.1", token(prepare(":1.1", "PrepareToPreview", name)));
  settle();
  EXPECT_EQ(linesContaining("Received request to schedule finalization").size(), 1u);
}

TEST_F(FinalizationTest, ABundleThatDoesNotLoadIsNotExportedAndItsWaveformIsSkipped) {
  auto editor = makeRecording("Broken", {0.2});
  ASSERT_TRUE(editor);
  const std::string name = editor->composedAVURL().lastPathComponent();
  std::ofstream(editor->composition()->bundleURL().path() + "/manifest.json") << "{ not json";
  auto exported = call(":1.1", "PrepareToExport", {url(name), true});
  advance(0s);
  ASSERT_TRUE(exported->waitFor(10s));
  ASSERT_FALSE(exported->isError()) << exported->errorName();
  EXPECT_EQ(exported->values().at(0).fields().at(1).asInt32(), 0);  // no token, no error
  EXPECT_EQ(openSessions(), 0u);
  auto failed = linesContaining("ERROR: <CompositionExportOperation");
  ASSERT_EQ(failed.size(), 1u);
  EXPECT_NE(failed[0].find(std::string(RCSSavedRecordingServiceErrorDomain) + " Code=401"),
            std::string::npos);
  EXPECT_EQ(linesContaining("ERROR: Skipping <GenerateWaveformOperation").size(), 1u);
  EXPECT_TRUE(std::filesystem::exists(editor->composition()->bundleURL().path()));
}

// A fragment damaged after it was recorded is left out of the export and
// kept; once its bytes are back, the fragment cleanup of the next session
// takes it back in and the next export composes it again.
TEST_F(FinalizationTest, ADamagedFragmentIsLeftOutOfTheExportUntilItReadsAgain) {
  auto editor = makeRecording("Damaged", {0.4, 0.2});
  ASSERT_TRUE(editor);
  const std::string name = editor->composedAVURL().lastPathComponent();
  const std::string fragment = editor->composition()->fragments()[1].AVOutputURL().path();
  const std::string bytes = testing::readFile(fragment);
  damage(fragment);

  auto exported = call(":1.1", "PrepareToExport", {url(name), false});
  advance(0s);
  end(":1.1", token(exported));
  settle();
  EXPECT_NEAR(composedSeconds(*editor), 0.4, 0.03);
  auto manifest = manifestOf(*editor);
  ASSERT_EQ(manifest.fragments.size(), 2u);
  EXPECT_FALSE(manifest.fragments[0].unreadable);
  EXPECT_TRUE(manifest.fragments[1].unreadable);
  EXPECT_NEAR(manifest.composedDuration, 0.4, 0.01);
  EXPECT_TRUE(std::filesystem::exists(fragment));
  const std::string leftOut =
      "WARNING: leaving fragment '" + std::filesystem::path(fragment).filename().string() +
      "' of Damaged.composition out of the composed audio: it cannot be read";
  EXPECT_EQ(linesAt(platform::kLogLevelError, leftOut), 1u);

  std::ofstream(fragment, std::ios::binary | std::ios::trunc) << bytes;
  end(":1.2", token(prepare(":1.2", "PrepareToPreview", name)));
  settle();
  EXPECT_FALSE(manifestOf(*editor).fragments[1].unreadable);
  exported = call(":1.1", "PrepareToExport", {url(name), false});
  advance(0s);
  end(":1.1", token(exported));
  settle();
  EXPECT_NEAR(composedSeconds(*editor), 0.6, 0.03);
  EXPECT_EQ(decomposed(*editor), 0u);
  EXPECT_EQ(linesAt(platform::kLogLevelError, leftOut), 1u);
  expectNothingLeft();
}

// Fails every job as a media worker that died would.
class DeadWorkerEngine final : public testing::DelegatingMediaEngine {
 public:
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeWorkerFailed, "killed probing " + url.path()));
  }
  platform::Status compose(const std::vector<RCComposerSegment>&, const platform::URL& destination,
                           const std::optional<platform::URL>&, const RCMediaProgress&) override {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeWorkerFailed, "killed composing " + destination.path()));
  }
};

// The export fails (401) when no fragment can be read, and when the media
// worker fails, which says nothing about the files: then even a damaged
// fragment is not marked. Either way every file stays.
TEST_F(FinalizationTest, AnExportWithNoReadableFragmentOrNoWorkerFailsAndKeepsTheFiles) {
  struct Case {
    std::string title;
    std::size_t damaged;  // fragments damaged, from the last
    std::shared_ptr<RCMediaEngine> engine;
    std::size_t marked;  // fragments marked unreadable after
  };
  for (const Case& c : std::vector<Case>{
           {"EveryFragmentDamaged", 2, std::make_shared<RCInProcessMediaEngine>(), 2},
           {"WorkerDied", 1, std::make_shared<DeadWorkerEngine>(), 0},
       }) {
    SCOPED_TRACE(c.title);
    auto editor = makeRecording(c.title, {0.2, 0.2});
    ASSERT_TRUE(editor);
    auto fragments = editor->composition()->fragments();
    for (std::size_t i = fragments.size() - c.damaged; i < fragments.size(); ++i)
      damage(fragments[i].AVOutputURL().path());
    RCMediaEngine::setCurrent(c.engine);
    auto exported = call(":1.1", "PrepareToExport", {url(c.title + ".m4a"), false});
    advance(0s);
    RCUseInProcessMediaEngine();
    ASSERT_TRUE(exported->waitFor(10s));
    ASSERT_FALSE(exported->isError()) << exported->errorName();
    EXPECT_EQ(exported->values().at(0).fields().at(1).asInt32(), 0);  // no token
    auto failed = linesContaining("/" + c.title + ".m4a failed with error: ");
    ASSERT_EQ(failed.size(), 1u);
    EXPECT_NE(failed[0].find(std::string(RCSSavedRecordingServiceErrorDomain) + " Code=401"),
              std::string::npos);
    auto manifest = manifestOf(*editor);
    ASSERT_EQ(manifest.fragments.size(), 2u);
    EXPECT_EQ(std::size_t(std::ranges::count_if(
                  manifest.fragments, [](const auto& entry) { return entry.unreadable; })),
              c.marked);
    for (const auto& fragment : fragments) EXPECT_TRUE(exists(fragment.AVOutputURL()));
    EXPECT_FALSE(exists(editor->composedAVURL()));
    settle();
  }
}

// Holds every compose at a gate until the test opens it, counting them.
class HeldComposeEngine final : public testing::DelegatingMediaEngine {
 public:
  platform::Status compose(const std::vector<RCComposerSegment>& segments,
                           const platform::URL& destination,
                           const std::optional<platform::URL>& waveform,
                           const RCMediaProgress& progress) override {
    gate.update([&] { ++composes; });
    gate.waitUntil([&] { return open; });
    return DelegatingMediaEngine::compose(segments, destination, waveform, progress);
  }
  platform::testing::Gate gate;
  int composes = 0;   // guarded by gate
  bool open = false;  // guarded by gate
};

TEST_F(FinalizationTest, TwoSpellingsOfOneRecordingExportTogetherWithOneCompose) {
  auto editor = makeRecording("Walk", {0.3, 0.2});
  ASSERT_TRUE(editor);
  auto engine = std::make_shared<HeldComposeEngine>();
  RCMediaEngine::setCurrent(engine);
  const std::string plain = url("Walk.m4a");
  const std::string dotted = "file://" + directory_.string() + "/./Walk.m4a";
  auto first = call(":1.1", "PrepareToExport", {plain, false});
  ASSERT_TRUE(engine->gate.waitUntil([&] { return engine->composes == 1; }));
  auto second = call(":1.2", "PrepareToExport", {dotted, false});
  // Both finalizations are running: the second waits for the bundle.
  ASSERT_TRUE(waitForLines("RUNNING asset finalization operation", 2));
  engine->gate.update([&] { engine->open = true; });
  advance(0s);
  EXPECT_EQ(token(first).fields().at(2).asString(), plain);
  EXPECT_EQ(token(second).fields().at(2).asString(), dotted);
  EXPECT_EQ(engine->composes, 1);
  EXPECT_EQ(decomposed(*editor), 0u);
  RCUseInProcessMediaEngine();
}

// An edit finalizes its recording once: ending a capture while a trim waits
// for it, then ending the trim, runs the one waiting finalization.
TEST_F(FinalizationTest, EndingAnEditWhoseFinalizationWaitsStartsNoSecondOne) {
  auto editor = makeRecording("Edit", {0.2});
  ASSERT_TRUE(editor);
  const std::string name = "Edit.m4a";
  auto capture = token(prepare(":1.1", "PrepareToCapture", name));
  auto held = holdServiceQueue();
  end(":1.1", capture);
  auto trim = prepare(":1.2", "PrepareToTrim", name);  // deferred behind the closing capture
  held->count_down();
  auto trimToken = token(trim);
  settle();
  EXPECT_EQ(waitingFinalizations(), 1u);
  const std::size_t signalsBefore = changeSignals();
  end(":1.2", trimToken);
  settle();
  EXPECT_EQ(linesContaining("Received request to schedule finalization of 'Edit.m4a'").size(), 2u);
  EXPECT_EQ(changeSignals() - signalsBefore, 2u);
  EXPECT_EQ(decomposed(*editor), 0u);
  EXPECT_EQ(waitingFinalizations(), 0u);
  expectNothingLeft();
}

// A deferred request taken out for re-issue whose client vanishes before it
// runs hands its turn to the recording's waiting finalization.
TEST_F(FinalizationTest, ARequestWhoseClientVanishedBeforeItsReissueLetsTheFinalizationRun) {
  auto editor = makeRecording("Gone", {0.2});
  ASSERT_TRUE(editor);
  const std::string name = "Gone.m4a";
  auto capture = token(prepare(":1.1", "PrepareToCapture", name));
  service_->_attemptToRunDeferredFinalizationOfCompositionAVURL(editor->composedAVURL());
  drainServiceQueue();
  ASSERT_EQ(waitingFinalizations(), 1u);

  // The queue runs: the close's first step, the preview's deferral, the
  // cleanup (which queues the final step) and then `marker`, which lets
  // the client vanish while the final step waits; that step takes the
  // preview out and queues its re-issue behind the disconnection.
  auto held = holdServiceQueue();
  end(":1.1", capture);
  auto preview = prepare(":1.2", "PrepareToPreview", name);
  auto marker = std::make_shared<std::latch>(1);
  auto reached = std::make_shared<std::latch>(1);
  service_->serviceSerialQueue().async([this, held, marker, reached] {
    service_->serviceSerialQueue().async([marker, reached] {
      reached->count_down();
      marker->wait();
    });
  });
  held->count_down();
  reached->wait();
  listener_->vanish(":1.2");
  marker->count_down();
  settle();
  EXPECT_EQ(linesContaining("Not opening 'preview' access session").size(), 1u);
  EXPECT_EQ(waitingFinalizations(), 0u);
  EXPECT_EQ(decomposed(*editor), 0u);
  expectNothingLeft();
}

// What a client may send that names nothing is not an error: exporting a
// recording that has no bundle, and ending a token whose identifier is not a
// UUID.
TEST_F(FinalizationTest, ARecordingWithoutABundleAndAForeignTokenAreNotErrors) {
  auto exported = call(":1.1", "PrepareToExport", {url("Nothing.m4a"), false});
  advance(0s);
  BusValue granted = token(exported);
  EXPECT_EQ(granted.fields().at(1).asInt32(), 1);
  end(":1.1", granted);
  call(":1.1", "EndAccessSession", {BusValue::structure({"preview", 1, url("X.m4a"), "no-uuid"})},
       true);
  settle();
  EXPECT_TRUE(linesContaining("cannot load the composition").empty());
  EXPECT_TRUE(linesContaining("parameter is required").empty());
  EXPECT_EQ(linesContaining("Ending access session: <RCSSavedRecordingAccessToken name=preview "
                            "type=1 (shared) compositionAVURL=" +
                            url("X.m4a") + " identifier=no-uuid>.")
                .size(),
            1u);
}

}  // namespace
}  // namespace quorvel

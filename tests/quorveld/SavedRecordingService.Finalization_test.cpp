// Finalization through the service core on real recordings: an export that
// composes and caches the waveform first, fragments whose files are damaged,
// a failing media worker, two spellings of one recording, and an edit whose
// finalization waits.
#include <gtest/gtest.h>

#include <ranges>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "tests/quorveld/ServiceFixture.h"
#include "tests/support/HeldMediaEngine.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

class FinalizationTest : public SessionTest {
 public:
  std::size_t changeSignals() {
    return std::ranges::count(listener_->emittedSignals() | std::views::keys,
                              std::string("ExportingCompositionAVURLsChanged"));
  }
  static bool exists(const platform::URL& url) { return std::filesystem::exists(url.path()); }
  // Whether each fragment of the recording's manifest is marked unreadable.
  std::vector<bool> unreadable(const RCCompositionEditor& editor) {
    auto loaded = RCComposition::load(editor.composition()->bundleURL());
    EXPECT_TRUE(loaded) << loaded.error();
    std::vector<bool> marks;
    if (loaded)
      for (const auto& fragment : (*loaded)->manifest().fragments)
        marks.push_back(fragment.unreadable);
    return marks;
  }
  double composedSeconds(const RCCompositionEditor& editor) {
    auto asset = RCAudioAsset::assetWithURL(editor.composedAVURL());
    return asset ? asset->duration() : -1;
  }
  std::vector<std::string> exporting() {
    auto fetched = call(":1.9", "FetchExportingCompositionAVURLs");
    EXPECT_TRUE(fetched->waitFor(10s));
    return fetched->values().at(0).asStringArray();
  }
};

TEST_F(FinalizationTest, AnExportAnswersOnceItsRecordingIsComposedWithItsWaveform) {
  auto editor = makeRecording("Walk", {0.3, 0.2});
  // Held back, so the exporting set can be seen while the work is pending.
  service_->assetExportController().setMaxConcurrentOperationCountForTesting(0);
  auto exported = call(":1.1", "PrepareToExport", {url("Walk.m4a"), true});
  auto second = call(":1.2", "PrepareToExport", {url("Walk.m4a"), false});
  for (int i = 0; i < 12; ++i) drainServiceQueue();
  EXPECT_EQ(exporting(), std::vector<std::string>{url("Walk.m4a")});
  EXPECT_EQ(service_->assetExportController().pendingOperationCountForTesting(), 2u);

  service_->assetExportController().setMaxConcurrentOperationCountForTesting(2);
  advance(0s);
  EXPECT_EQ(accessType(exported), 1);
  EXPECT_EQ(accessType(second), 1);
  EXPECT_EQ(decomposed(editor), 0u);
  EXPECT_TRUE(exists(editor.composedAVURL()));
  EXPECT_TRUE(exists(RCWaveform::waveformURLForAVURL(editor.composedAVURL())));
  EXPECT_EQ(changeSignals(), 4u);  // handed over and answered, for each request
  EXPECT_TRUE(exporting().empty());
}

// A fragment damaged after it was recorded is left out of the export and
// kept; once its bytes are back, the fragment cleanup of the next session
// takes it back in and the next export composes it again.
TEST_F(FinalizationTest, ADamagedFragmentIsLeftOutOfTheExportUntilItReadsAgain) {
  auto editor = makeRecording("Damaged", {0.4, 0.2});
  const std::string fragment = editor.composition()->fragments()[1].AVOutputURL().path();
  const std::string bytes = testing::readFile(fragment);
  damage(fragment);
  auto exportAndEnd = [&] {
    auto exported = call(":1.1", "PrepareToExport", {url("Damaged.m4a"), false});
    advance(0s);
    end(":1.1", token(exported));
    settle();
  };
  exportAndEnd();
  EXPECT_NEAR(composedSeconds(editor), 0.4, 0.03);
  EXPECT_EQ(unreadable(editor), (std::vector<bool>{false, true}));
  auto loaded = RCComposition::load(editor.composition()->bundleURL());
  ASSERT_TRUE(loaded);
  EXPECT_NEAR((*loaded)->manifest().composedDuration, 0.4, 0.01);
  EXPECT_TRUE(std::filesystem::exists(fragment));

  testing::writeFile(fragment, bytes);
  end(":1.2", token(prepare(":1.2", "PrepareToPreview", "Damaged.m4a")));
  settle();
  EXPECT_EQ(unreadable(editor), (std::vector<bool>{false, false}));
  exportAndEnd();
  EXPECT_NEAR(composedSeconds(editor), 0.6, 0.03);
  EXPECT_EQ(decomposed(editor), 0u);
  expectNothingLeft();
}

// Fails every job as a media worker that died would.
class DeadWorkerEngine final : public testing::DelegatingMediaEngine {
 public:
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    return platform::fail(RCMediaError(RCMediaErrorCodeWorkerFailed, "killed: " + url.path()));
  }
  platform::Status compose(const std::vector<RCComposerSegment>&, const platform::URL& destination,
                           const std::optional<platform::URL>&, const RCMediaProgress&) override {
    return platform::fail(RCMediaError(RCMediaErrorCodeWorkerFailed, destination.path()));
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
    std::vector<bool> marked;  // fragments marked unreadable after
  };
  for (const Case& c : std::vector<Case>{
           {"EveryFragmentDamaged", 2, std::make_shared<RCInProcessMediaEngine>(), {true, true}},
           {"WorkerDied", 1, std::make_shared<DeadWorkerEngine>(), {false, false}},
       }) {
    SCOPED_TRACE(c.title);
    auto editor = makeRecording(c.title, {0.2, 0.2});
    auto fragments = editor.composition()->fragments();
    for (std::size_t i = fragments.size() - c.damaged; i < fragments.size(); ++i)
      damage(fragments[i].AVOutputURL().path());
    RCMediaEngine::setCurrent(c.engine);
    auto exported = call(":1.1", "PrepareToExport", {url(c.title + ".m4a"), false});
    advance(0s);
    RCUseInProcessMediaEngine();
    EXPECT_EQ(accessType(exported), 0);  // no token, and no error
    EXPECT_EQ(log_.count("/" + c.title +
                         ".m4a failed with error: Error "
                         "Domain=org.quorvel.SavedRecordingService.ErrorDomain Code=401"),
              1u);
    EXPECT_EQ(unreadable(editor), c.marked);
    for (const auto& fragment : fragments) EXPECT_TRUE(exists(fragment.AVOutputURL()));
    EXPECT_FALSE(exists(editor.composedAVURL()));
    settle();
  }
}

TEST_F(FinalizationTest, TwoSpellingsOfOneRecordingExportTogetherWithOneCompose) {
  auto editor = makeRecording("Walk", {0.3, 0.2});
  auto engine = std::make_shared<testing::HeldMediaEngine>();
  engine->holds = [](std::string_view job, const std::string&) { return job == "compose"; };
  RCMediaEngine::setCurrent(engine);
  const std::string plain = url("Walk.m4a");
  const std::string dotted = "file://" + directory_.string() + "/./Walk.m4a";
  auto first = call(":1.1", "PrepareToExport", {plain, false});
  ASSERT_TRUE(engine->waitForInside(1));
  auto second = call(":1.2", "PrepareToExport", {dotted, false});
  // Both finalizations are running: the second waits for the bundle.
  ASSERT_TRUE(log_.waitForCount("RUNNING asset finalization operation", 2));
  engine->open();
  advance(0s);
  EXPECT_EQ(token(first).fields().at(2).asString(), plain);
  EXPECT_EQ(token(second).fields().at(2).asString(), dotted);
  EXPECT_EQ(engine->came(), 1);
  EXPECT_EQ(decomposed(editor), 0u);
  RCUseInProcessMediaEngine();
}

// An edit finalizes its recording once: ending a capture while a trim waits
// for it, then ending the trim, runs the one waiting finalization (both ends
// ask for one).
TEST_F(FinalizationTest, EndingAnEditWhoseFinalizationWaitsStartsNoSecondOne) {
  auto editor = makeRecording("Edit", {0.2});
  auto capture = token(prepare(":1.1", "PrepareToCapture", "Edit.m4a"));
  auto held = holdServiceQueue();
  end(":1.1", capture);
  auto trim = prepare(":1.2", "PrepareToTrim", "Edit.m4a");  // deferred behind the closing capture
  held->count_down();
  auto trimToken = token(trim);
  settle();
  EXPECT_EQ(waitingFinalizations(), 1u);
  const std::size_t signalsBefore = changeSignals();
  end(":1.2", trimToken);
  settle();
  EXPECT_EQ(log_.count("Received request to schedule finalization of 'Edit.m4a'"), 2u);
  EXPECT_EQ(changeSignals() - signalsBefore, 2u);
  EXPECT_EQ(decomposed(editor), 0u);
  expectNothingLeft();
}

}  // namespace
}  // namespace quorvel

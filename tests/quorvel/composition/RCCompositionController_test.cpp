// Compositions made, edited, repaired and composed end to end on real audio:
// what an app builds through the editor composes into a playable file of the
// right length, a crash mid-capture is repaired into a consistent manifest,
// and audio that cannot be read is left out and kept instead of vanishing.
// Every test runs twice: with the media work in process, as in an app, and
// through the quorvel-media worker, as in the daemon.
#include <gtest/gtest.h>

#include <fstream>
#include <functional>
#include <future>
#include <thread>

#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/DelegatingMediaEngine.h"
#include "tests/support/MediaWorker.h"
#include "tests/support/RecordingsDirectoryFixture.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using platform::URL;

std::shared_ptr<RCCompositionController> controllerFor(const URL& composed) {
  return RCCompositionController::compositionControllerForComposedAVURL(composed);
}

double durationOf(const URL& url) {
  auto asset = RCAudioAsset::assetWithURL(url);
  return asset ? asset->duration() : -1;
}

std::vector<std::string> orphansOf(const RCComposition& composition) {
  std::vector<std::string> orphans;
  composition.enumerateOrphanedFragmentsWithBlock(
      [&](const RCCompositionFragment& fragment, bool&) {
        orphans.push_back(fragment.AVOutputURL().lastPathComponent());
      });
  return orphans;
}

class CompositionControllerTest : public testing::RecordingsDirectoryTest,
                                  public ::testing::WithParamInterface<bool> {
 protected:
  void SetUp() override {
    RecordingsDirectoryTest::SetUp();
    if (GetParam()) {
      auto options = testing::ScopedMediaWorkerEngine::defaults();
      options.extraSandboxDirectories = {root_.string()};
      worker_.emplace(std::move(options));
    }
    auto model = RCSavedRecordingsModel::modelWithDirectory(recordings_.string());
    ASSERT_TRUE(model) << model.error();
    model_ = *model;
  }

  URL tone(const std::string& name, double seconds, double frequency = 440) {
    std::string path = (root_ / "sources" / name).string();
    fs::create_directories(root_ / "sources");
    auto written = testing::writeTone(path, seconds, fs::path(name).extension().string().substr(1),
                                      44100, 1, frequency);
    EXPECT_TRUE(written) << written.error();
    return URL::fileURLWithPath(path);
  }

  // A new recording of `fragments`, appended in order.
  platform::Result<RCCompositionEditor> record(std::string_view name, std::string_view format,
                                               const std::vector<URL>& fragments = {}) {
    auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, name, format);
    for (std::size_t i = 0; editor && i < fragments.size(); ++i) {
      if (auto appended = editor->appendFragmentFromAudioFile(fragments[i]); !appended)
        return platform::fail(appended.error());
    }
    return editor;
  }

  // Composes through the asynchronous entry and waits for its callback,
  // which comes on another thread.
  bool compose(RCCompositionController& controller, bool deleteFragments, bool waveform = false) {
    std::promise<std::pair<bool, std::thread::id>> result;
    controller.rcs_composeToFinalDestinationAndDeleteDecomposedFragments(
        deleteFragments, waveform, false, [&](bool success) {
          result.set_value({success, std::this_thread::get_id()});
        });
    auto [success, thread] = result.get_future().get();
    EXPECT_NE(thread, std::this_thread::get_id());
    return success;
  }

  std::shared_ptr<RCSavedRecordingsModel> model_;
  std::optional<testing::ScopedMediaWorkerEngine> worker_;
};

TEST_P(CompositionControllerTest, AnEditedRecordingComposesToItsFragmentsUsedRanges) {
  auto editor = record("Walk", "m4a", {tone("one.m4a", 1.0, 440), tone("two.flac", 1.5, 880)});
  ASSERT_TRUE(editor) << editor.error();
  URL composed = editor->composedAVURL();
  EXPECT_EQ(composed.path(), (recordings_ / "Walk.m4a").string());
  ASSERT_TRUE(editor->setContentRangeOfFragment(0, 0.25, 0.5));
  EXPECT_DOUBLE_EQ(editor->composition()->composedDuration(), 2.0);
  ASSERT_TRUE(editor->setTitle(*model_, "Walk in the park"));

  auto controller = controllerFor(composed);
  ASSERT_TRUE(compose(*controller, false, true));
  auto pcm = testing::decodeToPCM(composed.path());
  ASSERT_TRUE(pcm) << pcm.error();
  EXPECT_NEAR(pcm->seconds(), 2.0, 0.05);
  // The first half second is the trimmed 440 Hz tone, then 880 Hz.
  EXPECT_NEAR(testing::estimatedFrequencyHz(*pcm, 2205, 19845), 440, 15);
  EXPECT_NEAR(testing::estimatedFrequencyHz(*pcm, 26460, 83790), 880, 15);
  EXPECT_TRUE(fs::exists(RCWaveform::waveformURLForAVURL(composed).path()));

  // Nothing is decomposed any more, and the manifest on disk says so.
  EXPECT_TRUE(controller->composition()->decomposedFragments().empty());
  auto reloaded = controllerFor(composed);
  ASSERT_TRUE(reloaded->composition());
  EXPECT_TRUE(reloaded->composition()->decomposedFragments().empty());
  EXPECT_NEAR(reloaded->composition()->composedDuration(), 2.0, 1e-9);
  // Composing again has nothing to do and succeeds.
  EXPECT_TRUE(compose(*reloaded, false));

  // The title landed in the database.
  auto recording = model_->recordingWithURL(composed);
  ASSERT_TRUE(recording && *recording);
  EXPECT_EQ((*recording)->customLabel(), "Walk in the park");
  EXPECT_EQ((*recording)->URIRepresentation(), reloaded->composition()->savedRecordingURI());
}

// An app that appends a fragment while the daemon composes the recording.
class InterruptedComposeEngine : public testing::DelegatingMediaEngine {
 public:
  InterruptedComposeEngine(std::shared_ptr<RCMediaEngine> inner, std::function<void()> during)
      : DelegatingMediaEngine(std::move(inner)), during_(std::move(during)) {}
  platform::Status compose(const std::vector<RCComposerSegment>& segments, const URL& destination,
                           const std::optional<URL>& waveform,
                           const RCMediaProgress& progress) override {
    auto composed = DelegatingMediaEngine::compose(segments, destination, waveform, progress);
    during_();
    return composed;
  }

 private:
  std::function<void()> during_;
};

TEST_P(CompositionControllerTest, AFragmentAppendedWhileComposingIsNeitherLostNorOrphaned) {
  auto editor = record("Talk", "m4a", {tone("one.wav", 0.5)});
  ASSERT_TRUE(editor) << editor.error();
  URL composed = editor->composedAVURL(), second = tone("two.wav", 0.5, 880);
  auto inner = RCMediaEngine::current();
  RCMediaEngine::setCurrent(std::make_shared<InterruptedComposeEngine>(inner, [&] {
    auto app = RCCompositionEditor::editorForComposedAVURL(composed);
    ASSERT_TRUE(app) << app.error();
    ASSERT_TRUE(app->appendFragmentFromAudioFile(second));
  }));
  EXPECT_FALSE(compose(*controllerFor(composed), false));
  RCMediaEngine::setCurrent(inner);

  // The appended fragment is still in the manifest, still to be composed,
  // and the next compose takes both.
  auto reloaded = controllerFor(composed);
  ASSERT_TRUE(reloaded->composition());
  ASSERT_EQ(reloaded->composition()->fragments().size(), 2u);
  EXPECT_EQ(reloaded->composition()->decomposedFragments().size(), 2u);
  ASSERT_TRUE(compose(*reloaded, false));
  EXPECT_NEAR(durationOf(composed), 1.0, 0.05);
}

TEST_P(CompositionControllerTest, NewRecordingsGetFreeNamesAndBadNamesPlacesAndEditsAreRefused) {
  testing::writeFile(recordings_ / "Memo.flac", "taken by a bare file");
  auto first = record("Memo", "wav", {tone("a.wav", 0.25)}), second = record("Memo", "wav");
  ASSERT_TRUE(first && second);
  EXPECT_EQ(first->composedAVURL().lastPathComponent(), "Memo 2.wav");
  EXPECT_EQ(second->composedAVURL().lastPathComponent(), "Memo 3.wav");
  EXPECT_TRUE(controllerFor(first->composedAVURL())->composition());
  // A URL with ".." that lands on the recording is the recording.
  EXPECT_TRUE(controllerFor(URL::fileURLWithPath(recordings_.string() + "/x/../Memo 2.wav"))
                  ->composition());

  // Controllers exist only for audio files of recordings directly in the directory.
  auto controls = [&](const fs::path& path) {
    auto controller = controllerFor(URL::fileURLWithPath(path.string()));
    return controller->composition() || compose(*controller, false);
  };
  for (const auto& [name, format] :
       std::vector<std::pair<std::string, std::string>>{{"../Escape", "m4a"},
                                                        {"a/b", "m4a"},
                                                        {"", "m4a"},
                                                        {"..", "m4a"},
                                                        {"\xff\xfe", "m4a"} /* not UTF-8 */,
                                                        {"x", "mp3"}}) {
    EXPECT_FALSE(record(name, format)) << name;
  }
  // Outside, in its bundle, not a capture format, another capture format, missing.
  for (const fs::path& path :
       {root_ / "Memo 2.wav", recordings_ / "Memo 2.composition/Memo 2.wav",
        recordings_ / "Memo 2.mp3", recordings_ / "Memo 2.m4a", recordings_ / "Missing.wav"}) {
    EXPECT_FALSE(controls(path)) << path;
  }
  EXPECT_FALSE(RCCompositionEditor::editorForComposedAVURL(
      URL::fileURLWithPath((root_ / "Memo 2.wav").string())));
  EXPECT_FALSE(first->trimToTimeRange({5, 1}));                  // past the end
  EXPECT_FALSE(first->setContentRangeOfFragment(0, 0.1, 0.25));  // past the file's end
  EXPECT_FALSE(first->setContentRangeOfFragment(3, 0, 0.1));     // no such fragment
  EXPECT_FALSE(fs::exists(root_ / "Escape.composition"));
  int records = 0;
  ASSERT_TRUE(model_->enumerateExistingRecordingsWithBlock(
      [&](const std::shared_ptr<RCSavedRecording>&, bool&) { ++records; }));
  EXPECT_EQ(records, 2);
}

TEST_P(CompositionControllerTest, RepairAfterACrashMidCaptureLeavesAConsistentManifest) {
  auto editor = record("Crash", "wav", {tone("base.wav", 1.0), tone("gone.wav", 0.5)});
  ASSERT_TRUE(editor) << editor.error();
  // A capture that wrote its audio but crashed before recording its length.
  auto captured = editor->beginFragment("wav");
  ASSERT_TRUE(captured);
  fs::copy_file(tone("captured.wav", 0.75).path(), captured->path());
  // A capture that crashed before its first byte.
  auto empty = editor->beginFragment("flac");
  ASSERT_TRUE(empty);
  std::ofstream(empty->path()).close();
  // A capture whose entry was written but whose file never appeared.
  ASSERT_TRUE(editor->beginFragment("m4a"));
  // And a fragment deleted behind the recording's back.
  fs::remove(editor->composition()->fragments()[1].AVOutputURL().path());

  auto controller = controllerFor(editor->composedAVURL());
  ASSERT_EQ(controller->composition()->fragments().size(), 5u);
  controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
  auto repaired = controller->composition();
  ASSERT_EQ(repaired->fragments().size(), 2u);
  EXPECT_EQ(repaired->fragments()[1].AVOutputURL(), *captured);
  ASSERT_TRUE(repaired->fragments()[1].contentDuration());
  EXPECT_NEAR(*repaired->fragments()[1].contentDuration(), 0.75, 0.01);
  EXPECT_NEAR(repaired->fragments()[1].timeRangeInComposition().start, 1.0, 0.01);
  EXPECT_NEAR(repaired->composedDuration(), 1.75, 0.02);
  EXPECT_TRUE(logged("NOTE: dropping fragment"));

  // The repaired manifest is on disk; repairing again changes nothing.
  auto fromDisk = RCComposition::compositionLoadedFromCompositionBundleURL(repaired->bundleURL());
  ASSERT_TRUE(fromDisk);
  EXPECT_EQ(fromDisk->manifest(), repaired->manifest());
  controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
  EXPECT_EQ(controller->composition(), repaired);
  // The empty file is now an orphan; the daemon's cleanup would delete it.
  EXPECT_EQ(orphansOf(*repaired), std::vector<std::string>{empty->lastPathComponent()});

  ASSERT_TRUE(compose(*controller, false));
  EXPECT_NEAR(durationOf(editor->composedAVURL()), 1.75, 0.02);
}

// A fragment that cannot be read is left out by the repair or the compose
// that finds it, and kept: fragments are deleted once composed, but not
// while one is left out, as it can only be composed back in its place with
// the others. The repair keeps it out while it stays as it is, also where
// only decoding shows the damage, and takes it back once its bytes are
// restored.
TEST_P(CompositionControllerTest, AnUnreadableFragmentIsLeftOutAndKeptUntilItReadsAgain) {
  struct Case {
    std::string name;
    testing::ToneOptions tone;
    std::function<void(const std::string& path)> damage;
    bool openEnded;  // captured, its length never recorded
  };
  constexpr auto MoovFirst = testing::M4ALayout::MoovFirst;
  auto cut = [](double fraction) {
    return [fraction](const std::string& path) {
      fs::resize_file(path, std::uintmax_t(double(fs::file_size(path)) * fraction));
    };
  };
  auto overwriteHeader = [](const std::string& path) {
    std::fstream(path, std::ios::binary | std::ios::in | std::ios::out) << std::string(64, 'Z');
  };
  for (const Case& c : std::vector<Case>{
           {"HeaderOverwritten", {.format = "wav"}, overwriteHeader, false},
           {"MovieHeaderCutOff", {.format = "m4a"}, cut(0.5), false},
           {"CaptureCutOff", {.format = "m4a"}, cut(0.5), true},
           // The header is intact, so a probe passes: only decoding finds it.
           {"AudioDataCut", {.format = "m4a", .layout = MoovFirst}, cut(0.6), false},
       }) {
    SCOPED_TRACE(c.name);
    auto editor = record(c.name, "m4a");
    ASSERT_TRUE(editor);
    for (const auto& [file, seconds] :
         {std::pair{"first", 0.5}, {"damaged", 1.0}, {"last", 0.25}}) {
      testing::ToneOptions tone = c.tone;
      tone.seconds = seconds;
      std::string path = (root_ / (c.name + file + "." + tone.format)).string();
      ASSERT_TRUE(testing::writeTone(path, tone));
      if (c.openEnded && seconds == 1.0) {
        auto captured = editor->beginFragment(tone.format);
        ASSERT_TRUE(captured);
        fs::copy_file(path, captured->path());
      } else {
        ASSERT_TRUE(editor->appendFragmentFromAudioFile(URL::fileURLWithPath(path)));
      }
    }
    const std::string damaged = editor->composition()->fragments()[1].AVOutputURL().path();
    const std::string bytes = testing::readFile(damaged);
    c.damage(damaged);
    auto controller = controllerFor(editor->composedAVURL());
    // A capture cut off is found by the repair that runs when its session ends.
    if (c.openEnded) controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
    ASSERT_TRUE(compose(*controller, /*deleteFragments=*/true));
    EXPECT_NEAR(durationOf(editor->composedAVURL()), 0.75, 0.05);
    // Said once, not at every compose (its words are pinned in the service log's table).
    const std::string leftOut =
        "leaving fragment '" + fs::path(damaged).filename().string() + "' of " + c.name + ".";
    EXPECT_EQ(loggedCount(leftOut, platform::kLogLevelError), 1u);
    RCCompositionManifest composed = controller->composition()->manifest();
    ASSERT_EQ(composed.fragments.size(), 3u);
    EXPECT_TRUE(composed.fragments[0].composed && composed.fragments[2].composed);
    EXPECT_TRUE(composed.fragments[1].unreadable && !composed.fragments[1].composed);
    EXPECT_EQ(composed.fragments[1].timeRangeInComposition, (RCTimeRange{0.5, 0}));
    EXPECT_NEAR(composed.composedDuration, 0.75, 0.01);
    EXPECT_EQ(controllerFor(editor->composedAVURL())->composition()->manifest(), composed);
    for (const auto& fragment : controller->composition()->fragments()) {
      EXPECT_TRUE(fs::exists(fragment.AVOutputURL().path()));
    }

    controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
    EXPECT_EQ(controller->composition()->manifest(), composed);

    testing::writeFile(damaged, bytes);
    controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
    ASSERT_EQ(controller->composition()->decomposedFragments().size(), 1u);
    ASSERT_TRUE(compose(*controller, false));
    // AAC fragments join on whole frames, a few per join.
    EXPECT_NEAR(durationOf(editor->composedAVURL()), 1.75, 0.1);
    EXPECT_EQ(loggedCount(leftOut, platform::kLogLevelError), 1u);
  }

  // With nothing readable at all, composing fails and changes nothing.
  auto lone = record("Lost", "m4a");
  ASSERT_TRUE(lone);
  auto lost = lone->beginFragment("m4a");
  ASSERT_TRUE(lost);
  testing::writeFile(lost->path(), "not audio");
  auto nothing = controllerFor(lone->composedAVURL());
  const std::string manifestBefore = nothing->composition()->manifest().serialize();
  EXPECT_FALSE(compose(*nothing, false));
  EXPECT_FALSE(fs::exists(lone->composedAVURL().path()));
  EXPECT_EQ(nothing->composition()->manifest().serialize(), manifestBefore);
  EXPECT_TRUE(logged("ERROR: composing Lost.m4a failed"));
}

TEST_P(CompositionControllerTest, ComposedAndDeletedFragmentsComeBackForTheNextTrim) {
  auto editor = record("Trim", "flac", {tone("a.flac", 1.0), tone("b.flac", 1.0)});
  ASSERT_TRUE(editor);
  std::vector<std::string> fragmentFiles;
  for (const auto& fragment : editor->composition()->fragments())
    fragmentFiles.push_back(fragment.AVOutputURL().path());
  auto controller = controllerFor(editor->composedAVURL());
  ASSERT_TRUE(compose(*controller, true));
  for (const auto& file : fragmentFiles) EXPECT_FALSE(fs::exists(file)) << file;
  EXPECT_TRUE(controller->composition()->fragments().empty());
  // Repair keeps a composition that is only its composed file.
  controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
  EXPECT_NEAR(controller->composition()->composedDuration(), 2.0, 1e-9);

  // Trimming brings the composed audio back as a fragment and keeps [0.5, 1.25).
  auto again = RCCompositionEditor::editorForComposedAVURL(editor->composedAVURL());
  ASSERT_TRUE(again) << again.error();
  ASSERT_TRUE(again->trimToTimeRange({0.5, 0.75}));
  EXPECT_NEAR(again->composition()->composedDuration(), 0.75, 1e-9);
  ASSERT_TRUE(compose(*controllerFor(editor->composedAVURL()), false));
  EXPECT_NEAR(durationOf(editor->composedAVURL()), 0.75, 0.01);
}

TEST_P(CompositionControllerTest, TrimmingAwayAFragmentOrphansItsFile) {
  auto editor = record("Cut", "wav", {tone("a.wav", 1.0), tone("b.wav", 1.0)});
  ASSERT_TRUE(editor);
  std::string second = editor->composition()->fragments()[1].AVOutputURL().lastPathComponent();
  ASSERT_TRUE(editor->trimToTimeRange({0.25, 0.5}));
  ASSERT_EQ(editor->composition()->fragments().size(), 1u);
  EXPECT_NEAR(editor->composition()->fragments()[0].contentStart(), 0.25, 1e-9);
  EXPECT_EQ(orphansOf(*editor->composition()), std::vector<std::string>{second});
  // Removing the last fragment empties the recording, composed file included.
  testing::writeFile(editor->composedAVURL().path(), "stale");
  ASSERT_TRUE(editor->removeFragment(0));
  EXPECT_FALSE(fs::exists(editor->composedAVURL().path()));
  EXPECT_EQ(editor->composition()->composedDuration(), 0);
}

INSTANTIATE_TEST_SUITE_P(Engines, CompositionControllerTest, ::testing::Values(false, true),
                         [](const ::testing::TestParamInfo<bool>& info) {
                           return info.param ? "ThroughTheWorker" : "InProcess";
                         });

}  // namespace
}  // namespace quorvel

// Compositions made, edited, repaired and composed end to end on real audio:
// what an app builds through the editor composes into a playable file of the
// right length, a crash mid-capture is repaired into a consistent manifest,
// and audio that cannot be read makes composing fail instead of vanishing.
// Every test runs twice: with the media work in process, as in an app, and
// through the quorvel-media worker, as in the daemon.
#include <gtest/gtest.h>

#include <fstream>
#include <functional>
#include <future>
#include <thread>

#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/media/RCAudioAsset.h"
#include "Quorvel/media/RCMP4Atoms.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/MediaWorker.h"
#include "tests/support/RecordingsDirectoryFixture.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;

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
    fs::create_directories(root_ / "sources");
  }

  platform::URL tone(const std::string& name, double seconds, double frequency = 440) {
    std::string path = (root_ / "sources" / name).string();
    std::string format = fs::path(name).extension().string().substr(1);
    auto written = testing::writeTone(path, seconds, format, 44100, 1, frequency);
    EXPECT_TRUE(written) << written.error();
    return platform::URL::fileURLWithPath(path);
  }

  // Composes through the asynchronous entry and waits for its callback.
  bool compose(RCCompositionController& controller, bool deleteFragments, bool waveform) {
    std::promise<std::thread::id> called;
    std::promise<bool> result;
    controller.rcs_composeToFinalDestinationAndDeleteDecomposedFragments(
        deleteFragments, waveform, false, [&](bool success) {
          result.set_value(success);
          called.set_value(std::this_thread::get_id());
        });
    bool success = result.get_future().get();
    EXPECT_NE(called.get_future().get(), std::this_thread::get_id());
    return success;
  }

  static double durationOf(const platform::URL& url) {
    auto asset = RCAudioAsset::assetWithURL(url);
    return asset ? asset->duration() : -1;
  }

  std::shared_ptr<RCSavedRecordingsModel> model_;
  std::optional<testing::ScopedMediaWorkerEngine> worker_;
};

TEST_P(CompositionControllerTest, AnEditedRecordingComposesToItsFragmentsUsedRanges) {
  auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, "Walk");
  ASSERT_TRUE(editor) << editor.error();
  platform::URL composed = editor->composedAVURL();
  EXPECT_EQ(composed.path(), (recordings_ / "Walk.m4a").string());
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("one.m4a", 1.0, 440)));
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("two.flac", 1.5, 880)));
  ASSERT_TRUE(editor->setContentRangeOfFragment(0, 0.25, 0.5));
  EXPECT_DOUBLE_EQ(editor->composition()->composedDuration(), 2.0);
  ASSERT_TRUE(editor->setTitle(*model_, "Walk in the park"));

  auto controller = RCCompositionController::compositionControllerForComposedAVURL(composed);
  ASSERT_TRUE(controller->composition());
  EXPECT_EQ(controller->composition()->decomposedFragments().size(), 2u);
  ASSERT_TRUE(compose(*controller, false, true));

  EXPECT_NEAR(durationOf(composed), 2.0, 0.05);
  auto pcm = testing::decodeToPCM(composed.path());
  ASSERT_TRUE(pcm) << pcm.error();
  EXPECT_NEAR(pcm->seconds(), 2.0, 0.05);
  // The first half second is the trimmed 440 Hz tone, then 880 Hz.
  EXPECT_NEAR(testing::estimatedFrequencyHz(*pcm, 2205, 19845), 440, 15);
  EXPECT_NEAR(testing::estimatedFrequencyHz(*pcm, 26460, 83790), 880, 15);
  EXPECT_TRUE(fs::exists(RCWaveform::waveformURLForAVURL(composed).path()));

  // Nothing is decomposed any more, and the manifest on disk says so.
  EXPECT_TRUE(controller->composition()->decomposedFragments().empty());
  auto reloaded = RCCompositionController::compositionControllerForComposedAVURL(composed);
  ASSERT_TRUE(reloaded->composition());
  EXPECT_TRUE(reloaded->composition()->decomposedFragments().empty());
  EXPECT_NEAR(reloaded->composition()->composedDuration(), 2.0, 1e-9);
  // Composing again has nothing to do and succeeds.
  EXPECT_TRUE(compose(*reloaded, false, false));

  // The title landed in the database and in the file.
  auto recording = model_->recordingWithURL(composed);
  ASSERT_TRUE(recording && *recording);
  EXPECT_EQ((*recording)->customLabel(), "Walk in the park");
  EXPECT_EQ((*recording)->URIRepresentation(), reloaded->composition()->savedRecordingURI());
}

// An engine that runs `during` in the middle of composing, as an app that
// edits the recording while the daemon composes it.
class InterruptedComposeEngine : public RCMediaEngine {
 public:
  InterruptedComposeEngine(std::shared_ptr<RCMediaEngine> inner, std::function<void()> during)
      : inner_(std::move(inner)), during_(std::move(during)) {}
  platform::Result<RCMediaProbe> probe(const platform::URL& url) override {
    return inner_->probe(url);
  }
  platform::Status compose(const std::vector<RCComposerSegment>& segments,
                           const platform::URL& destination,
                           const std::optional<platform::URL>& waveform,
                           const RCMediaProgress& progress) override {
    auto composed = inner_->compose(segments, destination, waveform, progress);
    during_();
    return composed;
  }
  platform::Status buildWaveform(const platform::URL& audio, const platform::URL& destination,
                                 const RCMediaProgress& progress) override {
    return inner_->buildWaveform(audio, destination, progress);
  }
  platform::Status writeTitle(const platform::URL& file, const std::string& title,
                              const std::string& language) override {
    return inner_->writeTitle(file, title, language);
  }

 private:
  std::shared_ptr<RCMediaEngine> inner_;
  std::function<void()> during_;
};

TEST_P(CompositionControllerTest, AFragmentAppendedWhileComposingIsNeitherLostNorOrphaned) {
  auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, "Talk");
  ASSERT_TRUE(editor) << editor.error();
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("one.wav", 0.5)));
  platform::URL composed = editor->composedAVURL();
  auto controller = RCCompositionController::compositionControllerForComposedAVURL(composed);
  platform::URL second = tone("two.wav", 0.5, 880);
  auto inner = RCMediaEngine::current();
  RCMediaEngine::setCurrent(std::make_shared<InterruptedComposeEngine>(inner, [&] {
    auto app = RCCompositionEditor::editorForComposedAVURL(composed);
    ASSERT_TRUE(app) << app.error();
    ASSERT_TRUE(app->appendFragmentFromAudioFile(second));
  }));
  EXPECT_FALSE(compose(*controller, false, false));
  RCMediaEngine::setCurrent(inner);

  // The appended fragment is still in the manifest, still to be composed,
  // and the next compose takes both.
  auto reloaded = RCCompositionController::compositionControllerForComposedAVURL(composed);
  ASSERT_TRUE(reloaded->composition());
  ASSERT_EQ(reloaded->composition()->fragments().size(), 2u);
  EXPECT_EQ(reloaded->composition()->decomposedFragments().size(), 2u);
  ASSERT_TRUE(compose(*reloaded, false, false));
  EXPECT_NEAR(durationOf(composed), 1.0, 0.05);
}

TEST_P(CompositionControllerTest, NewRecordingsGetFreeNamesAndBadNamesAreRefused) {
  fs::create_directories(recordings_);
  std::ofstream(recordings_ / "Memo.flac") << "taken by a bare file";
  auto first = RCCompositionEditor::createCompositionForNewRecording(*model_, "Memo", "wav");
  auto second = RCCompositionEditor::createCompositionForNewRecording(*model_, "Memo", "wav");
  ASSERT_TRUE(first && second);
  EXPECT_EQ(first->composedAVURL().lastPathComponent(), "Memo 2.wav");
  EXPECT_EQ(second->composedAVURL().lastPathComponent(), "Memo 3.wav");
  for (const char* bad : {"../Escape", "a/b", "", ".."}) {
    EXPECT_FALSE(RCCompositionEditor::createCompositionForNewRecording(*model_, bad)) << bad;
  }
  EXPECT_FALSE(RCCompositionEditor::createCompositionForNewRecording(*model_, "x", "mp3"));
  EXPECT_FALSE(RCCompositionEditor::createCompositionForNewRecording(*model_, "\xff\xfe"));
  EXPECT_FALSE(fs::exists(root_ / "Escape.composition"));
  int records = 0;
  ASSERT_TRUE(model_->enumerateExistingRecordingsWithBlock(
      [&](const std::shared_ptr<RCSavedRecording>&, bool&) { ++records; }));
  EXPECT_EQ(records, 2);
}

TEST_P(CompositionControllerTest, RepairAfterACrashMidCaptureLeavesAConsistentManifest) {
  auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, "Crash", "wav");
  ASSERT_TRUE(editor);
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("base.wav", 1.0)));
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("gone.wav", 0.5)));
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

  auto controller =
      RCCompositionController::compositionControllerForComposedAVURL(editor->composedAVURL());
  ASSERT_TRUE(controller->composition());
  EXPECT_EQ(controller->composition()->fragments().size(), 5u);
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
  std::vector<std::string> orphans;
  repaired->enumerateOrphanedFragmentsWithBlock([&](const RCCompositionFragment& fragment, bool&) {
    orphans.push_back(fragment.AVOutputURL().lastPathComponent());
  });
  EXPECT_EQ(orphans, std::vector<std::string>{empty->lastPathComponent()});

  ASSERT_TRUE(compose(*controller, false, false));
  EXPECT_NEAR(durationOf(editor->composedAVURL()), 1.75, 0.02);
}

TEST_P(CompositionControllerTest, UnreadableAudioIsLeftOutAndKept) {
  auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, "Broken", "m4a");
  ASSERT_TRUE(editor);
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("good.m4a", 0.5)));
  // An m4a capture cut off before its movie header was written.
  auto cut = editor->beginFragment("m4a");
  ASSERT_TRUE(cut);
  std::string whole = tone("whole.m4a", 1.0).path();
  fs::copy_file(whole, cut->path());
  fs::resize_file(cut->path(), fs::file_size(whole) / 2);

  auto controller =
      RCCompositionController::compositionControllerForComposedAVURL(editor->composedAVURL());
  controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
  ASSERT_EQ(controller->composition()->fragments().size(), 2u);
  EXPECT_FALSE(controller->composition()->fragments()[1].contentDuration());
  EXPECT_TRUE(controller->composition()->manifest().fragments[1].unreadable);
  EXPECT_TRUE(logged("WARNING: leaving fragment '" + cut->lastPathComponent() +
                     "' of Broken.composition out of the composed audio"));

  // The readable rest is composed; the cut-off file stays listed, so
  // nothing deletes it, and so does the rest, to be composed with it should
  // it be rescued.
  ASSERT_TRUE(compose(*controller, true, false));
  EXPECT_NEAR(durationOf(editor->composedAVURL()), 0.5, 0.05);
  EXPECT_TRUE(fs::exists(cut->path()));
  auto reloaded =
      RCCompositionController::compositionControllerForComposedAVURL(editor->composedAVURL());
  ASSERT_EQ(reloaded->composition()->fragments().size(), 2u);
  EXPECT_TRUE(reloaded->composition()->manifest().fragments[1].unreadable);
  EXPECT_TRUE(reloaded->composition()->decomposedFragments().empty());
  EXPECT_NEAR(reloaded->composition()->composedDuration(), 0.5, 1e-6);

  // With nothing readable at all, composing fails and changes nothing.
  auto lone = RCCompositionEditor::createCompositionForNewRecording(*model_, "Lost", "m4a");
  ASSERT_TRUE(lone);
  auto lost = lone->beginFragment("m4a");
  ASSERT_TRUE(lost);
  fs::copy_file(cut->path(), lost->path());
  auto nothing =
      RCCompositionController::compositionControllerForComposedAVURL(lone->composedAVURL());
  std::string manifestBefore = nothing->composition()->manifest().serialize();
  EXPECT_FALSE(compose(*nothing, false, false));
  EXPECT_FALSE(fs::exists(lone->composedAVURL().path()));
  EXPECT_EQ(nothing->composition()->manifest().serialize(), manifestBefore);
  EXPECT_TRUE(logged("ERROR: composing Lost.m4a failed"));
}

// A fragment damaged after it was recorded (its length is in the manifest)
// is left out by the compose that finds it, and kept; the repair keeps it
// out while it stays as it is, also where only decoding shows the damage,
// and takes it back once its bytes are restored.
TEST_P(CompositionControllerTest, ADamagedFragmentIsLeftOutUntilItReadsAgain) {
  struct Case {
    std::string name;
    testing::ToneOptions tone;
    std::function<void(const std::string& path)> damage;
  };
  auto cut = [](double fraction) {
    return [fraction](const std::string& path) {
      fs::resize_file(path, std::uintmax_t(double(fs::file_size(path)) * fraction));
    };
  };
  auto overwriteHeader = [](const std::string& path) {
    std::fstream(path, std::ios::binary | std::ios::in | std::ios::out) << std::string(64, 'Z');
  };
  for (const Case& c : std::vector<Case>{
           {"HeaderOverwritten", {.seconds = 1.0, .format = "wav"}, overwriteHeader},
           {"MovieHeaderCutOff", {.seconds = 1.0, .format = "m4a"}, cut(0.5)},
           // The header is intact, so a probe passes: only decoding finds it.
           {"AudioDataCut",
            {.seconds = 1.0, .format = "m4a", .layout = testing::M4ALayout::MoovFirst},
            cut(0.6)},
       }) {
    SCOPED_TRACE(c.name);
    auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, c.name, "m4a");
    ASSERT_TRUE(editor);
    testing::ToneOptions first = c.tone, last = c.tone;
    first.seconds = 0.5;
    last.seconds = 0.25;
    for (const auto& [file, tone] :
         {std::pair{"first", first}, {"damaged", c.tone}, {"last", last}}) {
      std::string path = (root_ / "sources" / (c.name + file + "." + tone.format)).string();
      ASSERT_TRUE(testing::writeTone(path, tone));
      ASSERT_TRUE(editor->appendFragmentFromAudioFile(platform::URL::fileURLWithPath(path)));
    }
    const std::string damaged = editor->composition()->fragments()[1].AVOutputURL().path();
    const std::string bytes = testing::readFile(damaged);
    c.damage(damaged);
    auto controller =
        RCCompositionController::compositionControllerForComposedAVURL(editor->composedAVURL());

    // Fragments are deleted once composed, but not while one is left out:
    // it can only be composed back in its place with the others.
    ASSERT_TRUE(compose(*controller, /*deleteFragments=*/true, false));
    EXPECT_NEAR(durationOf(editor->composedAVURL()), 0.75, 0.05);
    const std::string leftOut = "WARNING: leaving fragment '" +
                                fs::path(damaged).filename().string() + "' of " + c.name +
                                ".composition out of the composed audio";
    EXPECT_EQ(loggedCount(leftOut, platform::kLogLevelError), 1u);
    RCCompositionManifest composed = controller->composition()->manifest();
    ASSERT_EQ(composed.fragments.size(), 3u);
    EXPECT_TRUE(composed.fragments[0].composed && composed.fragments[2].composed);
    EXPECT_TRUE(composed.fragments[1].unreadable);
    EXPECT_FALSE(composed.fragments[1].composed);
    EXPECT_EQ(composed.fragments[1].timeRangeInComposition, (RCTimeRange{0.5, 0}));
    EXPECT_NEAR(composed.composedDuration, 0.75, 0.01);
    for (const auto& fragment : controller->composition()->fragments()) {
      EXPECT_TRUE(fs::exists(fragment.AVOutputURL().path()));
    }

    controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
    EXPECT_EQ(controller->composition()->manifest(), composed);

    std::ofstream(damaged, std::ios::binary | std::ios::trunc) << bytes;
    controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
    ASSERT_EQ(controller->composition()->decomposedFragments().size(), 1u);
    ASSERT_TRUE(compose(*controller, false, false));
    // AAC fragments join on whole frames, a few per join.
    EXPECT_NEAR(durationOf(editor->composedAVURL()), 1.75, 0.1);
    EXPECT_EQ(loggedCount(leftOut, platform::kLogLevelError), 1u);
  }
}

TEST_P(CompositionControllerTest, ComposedAndDeletedFragmentsComeBackForTheNextTrim) {
  auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, "Trim", "flac");
  ASSERT_TRUE(editor);
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("a.flac", 1.0)));
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("b.flac", 1.0)));
  std::vector<std::string> fragmentFiles;
  for (const auto& fragment : editor->composition()->fragments()) {
    fragmentFiles.push_back(fragment.AVOutputURL().path());
  }
  auto controller =
      RCCompositionController::compositionControllerForComposedAVURL(editor->composedAVURL());
  ASSERT_TRUE(compose(*controller, true, false));
  for (const auto& file : fragmentFiles) EXPECT_FALSE(fs::exists(file)) << file;
  EXPECT_TRUE(controller->composition()->fragments().empty());
  EXPECT_NEAR(controller->composition()->composedDuration(), 2.0, 1e-9);
  // Repair keeps a composition that is only its composed file.
  controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
  EXPECT_NEAR(controller->composition()->composedDuration(), 2.0, 1e-9);

  // Trimming brings the composed audio back as a fragment and keeps [0.5, 1.25).
  auto again = RCCompositionEditor::editorForComposedAVURL(editor->composedAVURL());
  ASSERT_TRUE(again) << again.error();
  ASSERT_TRUE(again->trimToTimeRange({0.5, 0.75}));
  EXPECT_NEAR(again->composition()->composedDuration(), 0.75, 1e-9);
  // The same name with another capture extension is not this recording.
  platform::URL otherExtension = platform::URL::fileURLWithPath(
      editor->composedAVURL().path().substr(0, editor->composedAVURL().path().size() - 4) + "m4a");
  EXPECT_FALSE(RCCompositionController::compositionControllerForComposedAVURL(otherExtension)
                   ->composition());
  auto retrimmed =
      RCCompositionController::compositionControllerForComposedAVURL(editor->composedAVURL());
  ASSERT_TRUE(compose(*retrimmed, false, false));
  EXPECT_NEAR(durationOf(editor->composedAVURL()), 0.75, 0.01);
}

TEST_P(CompositionControllerTest, TrimmingAwayAFragmentOrphansItsFile) {
  auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, "Cut", "wav");
  ASSERT_TRUE(editor);
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("a.wav", 1.0)));
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("b.wav", 1.0)));
  std::string second = editor->composition()->fragments()[1].AVOutputURL().lastPathComponent();
  ASSERT_TRUE(editor->trimToTimeRange({0.25, 0.5}));
  ASSERT_EQ(editor->composition()->fragments().size(), 1u);
  EXPECT_NEAR(editor->composition()->fragments()[0].contentStart(), 0.25, 1e-9);
  std::vector<std::string> orphans;
  editor->composition()->enumerateOrphanedFragmentsWithBlock(
      [&](const RCCompositionFragment& fragment, bool&) {
        orphans.push_back(fragment.AVOutputURL().lastPathComponent());
      });
  EXPECT_EQ(orphans, std::vector<std::string>{second});
  EXPECT_FALSE(editor->trimToTimeRange({5, 1}));
  EXPECT_FALSE(editor->setContentRangeOfFragment(0, 0.5, 0.75));  // past the file's end
  EXPECT_FALSE(editor->setContentRangeOfFragment(3, 0, 0.1));
  // Removing the last fragment empties the recording, composed file included.
  std::ofstream(editor->composedAVURL().path()) << "stale";
  ASSERT_TRUE(editor->removeFragment(0));
  EXPECT_FALSE(fs::exists(editor->composedAVURL().path()));
  EXPECT_EQ(editor->composition()->composedDuration(), 0);
}

TEST_P(CompositionControllerTest, ControllersExistOnlyForAudioFilesDirectlyInTheDirectory) {
  auto editor = RCCompositionEditor::createCompositionForNewRecording(*model_, "Here", "wav");
  ASSERT_TRUE(editor);
  ASSERT_TRUE(editor->appendFragmentFromAudioFile(tone("a.wav", 0.25)));
  EXPECT_TRUE(
      RCCompositionController::compositionControllerForComposedAVURL(editor->composedAVURL())
          ->composition());
  for (const std::string& path :
       {(root_ / "Here.wav").string(), (recordings_ / "Here.composition/Here.wav").string(),
        (recordings_ / "Here.mp3").string(), (recordings_ / "Missing.wav").string()}) {
    auto controller = RCCompositionController::compositionControllerForComposedAVURL(
        platform::URL::fileURLWithPath(path));
    EXPECT_FALSE(controller->composition()) << path;
    EXPECT_FALSE(compose(*controller, false, false)) << path;
  }
  // A URL with ".." that lands on the recording is the recording.
  EXPECT_TRUE(RCCompositionController::compositionControllerForComposedAVURL(
                  platform::URL::fileURLWithPath(recordings_.string() + "/x/../Here.wav"))
                  ->composition());
  EXPECT_FALSE(RCCompositionEditor::editorForComposedAVURL(
      platform::URL::fileURLWithPath((root_ / "Here.wav").string())));
}

INSTANTIATE_TEST_SUITE_P(Engines, CompositionControllerTest, ::testing::Values(false, true),
                         [](const ::testing::TestParamInfo<bool>& info) {
                           return info.param ? "ThroughTheWorker" : "InProcess";
                         });

}  // namespace
}  // namespace quorvel

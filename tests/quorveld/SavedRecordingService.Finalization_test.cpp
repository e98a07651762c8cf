// Finalization through the service core on real recordings: an export that
// composes and caches the waveform first, a recording left by a vanished
// capture client, the background finalization after a capture, and a bundle
// that does not load.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "tests/quorveld/ServiceFixture.h"

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

}  // namespace
}  // namespace quorvel

// Composition bundles on disk: what loads, what is refused (and left exactly
// as it was), which files count as orphaned fragments, asset sizes, and the
// manifest written back.
#include <gtest/gtest.h>

#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/composition/RCCompositionManifest.h"
#include "Quorvel/errors/RCErrors.h"
#include "tests/support/RecordingsDirectoryFixture.h"

namespace quorvel {
namespace {

namespace fs = std::filesystem;
using CompositionTest = testing::RecordingsDirectoryTest;

using testing::readFile;
using testing::writeFile;

RCCompositionManifest twoFragments() {
  RCCompositionManifest manifest;
  manifest.composedName = "Walk.m4a";
  manifest.savedRecordingURI = "quorvel://recording/E621E1F8-C36C-495A-93FC-0C247A3E6E5F";
  manifest.fragments = {
      {"a.m4a", {0, 2}, 0.5, 2.0, true},
      {"b.wav", {2, 1.25}, 0, std::nullopt, false},
  };
  manifest.recomputeTimeRanges();
  return manifest;
}

TEST(CompositionManifestTest, RoundTripsAndLaysFragmentsEndToEnd) {
  RCCompositionManifest manifest = twoFragments();
  EXPECT_DOUBLE_EQ(manifest.composedDuration, 2.0);  // the open-ended one counts 0
  EXPECT_EQ(manifest.fragments[1].timeRangeInComposition, (RCTimeRange{2.0, 0}));
  auto parsed = RCCompositionManifest::parse(manifest.serialize());
  ASSERT_TRUE(parsed) << parsed.error();
  EXPECT_EQ(*parsed, manifest);

  // An unreadable fragment is out of the composed audio, whatever length it
  // had: it takes no time, and the mark survives the trip.
  manifest.fragments.insert(manifest.fragments.begin(),
                            {"c.flac", {0, 0}, 0, 3.0, false, /*unreadable=*/true});
  manifest.recomputeTimeRanges();
  EXPECT_DOUBLE_EQ(manifest.composedDuration, 2.0);
  EXPECT_EQ(manifest.fragments[1].timeRangeInComposition, (RCTimeRange{0, 2.0}));
  parsed = RCCompositionManifest::parse(manifest.serialize());
  ASSERT_TRUE(parsed) << parsed.error();
  EXPECT_EQ(*parsed, manifest);
}

TEST(CompositionManifestTest, RefusesEveryMalformedShapeWithAReason) {
  const std::string fragment =
      R"({"file":"a.m4a","timeRangeInComposition":{"start":0,"duration":1},)"
      R"("contentRange":{"start":0,"duration":1},"composed":false})";
  auto manifestWith = [&](const std::string& fragments, const std::string& composed = "\"W.m4a\"",
                          const std::string& version = "1") {
    return "{\"formatVersion\":" + version + ",\"composedAVURL\":" + composed +
           ",\"composedDuration\":1,\"savedRecordingURI\":null,\"fragments\":[" + fragments + "]}";
  };
  ASSERT_TRUE(RCCompositionManifest::parse(manifestWith(fragment)));
  auto replaced = [&](const std::string& from, const std::string& to) {
    std::string text = fragment;
    text.replace(text.find(from), from.size(), to);
    return manifestWith(text);
  };
  const std::string range = R"("contentRange":{"start":0,"duration":1})";
  // Which names are plain is the confinement test's; here, that both keys are checked.
  for (const auto& [json, reason] : std::vector<std::pair<std::string, std::string>>{
           {"", "not JSON"},
           {"[]", "not a JSON object"},
           {manifestWith(fragment, "\"W.m4a\"", "2"), "formatVersion 2"},
           {manifestWith(fragment, "\"W.m4a\"", "1.0"), "not an integer"},
           {manifestWith(fragment, "\"../W.m4a\""), "not a plain file name"},
           {manifestWith(fragment, "\"W.mp3\""), "capture format"},
           {manifestWith(fragment, "7"), "not a string"},
           {R"({"formatVersion":1,"composedAVURL":"W.m4a","composedDuration":1,"fragments":[]})",
            "savedRecordingURI is missing"},
           {replaced(R"("a.m4a")", R"("..")"), "not a plain file name"},
           {replaced(R"("a.m4a")", R"("a.M4A")"), "capture format"},
           {replaced(R"("start":0,"duration":1},"c)", R"("start":-1,"duration":1},"c)"),
            "non-negative"},
           {replaced(R"("composed":false)", R"("composed":0)"), "not true or false"},
           {replaced(R"(,"composed":false)", ""), "composed is missing"},
           {replaced(range, R"("contentRange":[0,1])"), "not an object"},
           {replaced(range, R"("contentRange":{"start":0})"), "contentRange.duration is missing"},
           {replaced(R"("duration":1},"composed")", R"("duration":1e999},"composed")"), "not JSON"},
           {manifestWith("7"), "fragments[0] is not an object"},
       }) {
    auto parsed = RCCompositionManifest::parse(json);
    ASSERT_FALSE(parsed) << json;
    EXPECT_EQ(parsed.error().code(), RCErrorCodeInvalidManifest);
    EXPECT_NE(parsed.error().localizedDescription().find(reason), std::string::npos)
        << json << " -> " << parsed.error().localizedDescription();
  }
  EXPECT_FALSE(RCCompositionManifest::parse(std::string(5 * 1024 * 1024, ' ')));
}

TEST_F(CompositionTest, BundlesThatMustNotLoadAreRefusedLoggedAndLeftUntouched) {
  const fs::path outside = root_ / "outside", secret = outside / "secret.m4a";
  writeFile(secret, "secret");
  auto manifestText = [](const std::string& composed, const std::string& fragmentFile) {
    RCCompositionManifest manifest;
    manifest.composedName = composed;
    manifest.fragments = {{fragmentFile, {0, 1}, 0, 1.0, false}};
    return manifest.serialize();
  };
  struct Case {
    std::string name;
    std::string manifest;                              // written into the bundle
    std::function<void(const fs::path& bundle)> make;  // or what makes the bundle
    std::string reason;
  };
  auto linkManifest = [&](const fs::path& b) {
    fs::create_directories(b);
    writeFile(outside / "manifest.json", manifestText("LinkedManifest.m4a", "f.m4a"));
    fs::create_symlink(outside / "manifest.json", b / "manifest.json");
  };
  auto linkBundle = [&](const fs::path& b) {
    writeFile(outside / "manifest.json", manifestText("LinkedBundle.m4a", "f.m4a"));
    fs::create_directory_symlink(outside, b);
  };
  const std::string wrongTypes =
      R"({"formatVersion":1,"composedAVURL":"WrongTypes.m4a","composedDuration":"1",)"
      R"("savedRecordingURI":null,"fragments":[]})";
  auto withFragment = [&](const char* composed, auto&& make) {
    return [&, composed, make](const fs::path& b) {
      writeFile(b / "manifest.json", manifestText(composed, "f.m4a"));
      make(b / "f.m4a");
    };
  };
  // clang-format off
  for (const Case& c : std::vector<Case>{
           {"NotJSON", "{{{", {}, "not JSON"},
           {"WrongTypes", wrongTypes, {}, "composedDuration is not a number"},
           {"NoManifest", "", [](const fs::path& b) { fs::create_directories(b); }, "manifest.json"},
           {"OtherRecording", manifestText("Someone Else.m4a", "f.m4a"), {},
            "not the audio file of this bundle"},
           {"LinkedFragment", "", withFragment("LinkedFragment.m4a",
                [&](const fs::path& f) { fs::create_symlink(secret, f); }), "symbolic link"},
           {"EscapingFragment", manifestText("EscapingFragment.m4a", "../../outside/secret.m4a"), {},
            "not a plain file name"},
           {"AbsoluteFragment", manifestText("AbsoluteFragment.m4a", secret.string()), {},
            "not a plain file name"},
           {"DirectoryFragment", "", withFragment("DirectoryFragment.m4a",
                [](const fs::path& f) { fs::create_directories(f); }), "not a regular file"},
           {"LinkedManifest", "", linkManifest, "manifest.json"},
           {"LinkedBundle", "", linkBundle, "symbolic link"},
       }) {
    // clang-format on
    SCOPED_TRACE(c.name);
    const fs::path bundle = recordings_ / (c.name + ".composition");
    c.make ? c.make(bundle) : writeFile(bundle / "manifest.json", c.manifest);
    const std::string before = fs::is_regular_file(fs::symlink_status(bundle / "manifest.json"))
                                   ? readFile(bundle / "manifest.json")
                                   : "";
    auto loaded = RCComposition::load(platform::URL::fileURLWithPath(bundle.string()));
    ASSERT_FALSE(loaded);
    EXPECT_NE(loaded.error().description().find(c.reason), std::string::npos) << loaded.error();
    // So neither the repair nor composing ever reads or removes what it names.
    auto controller = RCCompositionController::compositionControllerForComposedAVURL(
        platform::URL::fileURLWithPath((recordings_ / (c.name + ".m4a")).string()));
    EXPECT_FALSE(controller->composition());
    EXPECT_TRUE(logged("ERROR: cannot load the composition '" + c.name + ".composition'"));
    controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
    EXPECT_FALSE(controller->composeNow(/*deleteFragments=*/true, false));
    if (!before.empty()) {
      EXPECT_EQ(readFile(bundle / "manifest.json"), before);
    }
  }
  EXPECT_EQ(readFile(secret), "secret");

  // A good bundle outside the recordings directory does not load either.
  writeFile(root_ / "Foreign.composition/manifest.json", manifestText("Foreign.m4a", "f.m4a"));
  auto loaded =
      RCComposition::load(platform::URL::fileURLWithPath((root_ / "Foreign.composition").string()));
  ASSERT_FALSE(loaded);
  EXPECT_NE(loaded.error().localizedDescription().find("not directly inside"), std::string::npos);
}

// Orphaned fragments are capture files the manifest no longer uses.
TEST_F(CompositionTest, LoadsAValidBundleNamesItsFilesInsideTheDirectoryAndFindsOrphans) {
  fs::path bundle = recordings_ / "Walk.composition";
  writeFile(bundle / "manifest.json", twoFragments().serialize());
  writeFile(bundle / "a.m4a", std::string(1000, 'a'));
  writeFile(bundle / "b.wav", std::string(234, 'b'));
  writeFile(recordings_ / "Walk.m4a", std::string(50, 'w'));
  writeFile(recordings_ / "Walk.waveform", std::string(7, 'v'));
  writeFile(bundle / "c.m4a", "orphan");
  writeFile(bundle / "b.flac", "orphan: b.wav is the one in use");
  writeFile(bundle / "notes.txt", "not audio");
  writeFile(bundle / "D.M4A", "other case: not a capture extension");
  fs::create_directories(bundle / "dir.wav");
  fs::create_symlink(root_ / "nowhere", bundle / "dangling.wav");

  auto composition = RCComposition::compositionLoadedFromCompositionBundleURL(
      platform::URL::fileURLWithPath(bundle.string() + "/"));
  ASSERT_TRUE(composition);
  EXPECT_EQ(composition->composedAVURL().path(), (recordings_ / "Walk.m4a").string());
  EXPECT_EQ(
      RCComposition::compositionBundleURLForComposedAVURL(composition->composedAVURL()).path(),
      bundle.string());
  EXPECT_DOUBLE_EQ(composition->composedDuration(), 2.0);
  ASSERT_EQ(composition->fragments().size(), 2u);
  EXPECT_EQ(composition->fragments()[1].AVOutputURL().path(), (bundle / "b.wav").string());
  ASSERT_EQ(composition->decomposedFragments().size(), 1u);
  EXPECT_EQ(composition->decomposedFragments()[0].AVOutputURL().lastPathComponent(), "b.wav");
  EXPECT_FALSE(composition->decomposedFragments()[0].contentDuration());
  EXPECT_EQ(composition->fileSizeOfAssetsIncludingRelatedResources(false), 1000u + 234u + 50u);
  EXPECT_EQ(composition->fileSizeOfAssetsIncludingRelatedResources(true),
            1000u + 234u + 50u + 7u + fs::file_size(bundle / "manifest.json"));
  EXPECT_NE(composition->debugDescription().find("b.wav at 2.000+0.000 uses 0.000+open"),
            std::string::npos)
      << composition->debugDescription();

  auto orphans = [](const RCComposition& composition) {
    std::vector<std::string> names;
    composition.enumerateOrphanedFragmentsWithBlock(
        [&](const RCCompositionFragment& fragment, bool&) {
          names.push_back(fragment.AVOutputURL().lastPathComponent());
        });
    return names;
  };
  EXPECT_EQ(orphans(*composition), (std::vector<std::string>{"b.flac", "c.m4a", "dangling.wav"}));

  // Deleting them goes through the confined removal; the walk stops when asked.
  int visited = 0;
  composition->enumerateOrphanedFragmentsWithBlock(
      [&](const RCCompositionFragment& fragment, bool& stop) {
        EXPECT_TRUE(fragment.deleteFromFilesystem());
        stop = ++visited == 2;
      });
  EXPECT_EQ(visited, 2);
  EXPECT_EQ(orphans(*composition), std::vector<std::string>{"dangling.wav"});
  EXPECT_TRUE(fs::exists(bundle / "notes.txt"));

  // A fragment the manifest stops using becomes an orphan.
  RCCompositionManifest fewer = composition->manifest();
  fewer.fragments.erase(fewer.fragments.begin());
  ASSERT_TRUE(RCComposition(composition->bundleURL(), fewer).saveMetadataToDefaultLocation());
  EXPECT_EQ(
      orphans(*RCComposition::compositionLoadedFromCompositionBundleURL(composition->bundleURL())),
      (std::vector<std::string>{"a.m4a", "dangling.wav"}));
}

}  // namespace
}  // namespace quorvel

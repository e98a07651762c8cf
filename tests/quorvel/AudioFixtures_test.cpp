// The fixture generator itself: each format decodes back to the tone it was
// asked for, so tests built on it compare against known audio.
#include "tests/support/AudioFixtures.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace quorvel::testing {
namespace {

class AudioFixturesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = std::filesystem::temp_directory_path() /
           ("qv-fixtures-" + std::to_string(::getpid()) + "-" +
            ::testing::UnitTest::GetInstance()->current_test_info()->name());
    std::filesystem::create_directories(dir_);
  }
  void TearDown() override { std::filesystem::remove_all(dir_); }
  std::filesystem::path dir_;
};

TEST_F(AudioFixturesTest, EveryFormatDecodesToTheRequestedTone) {
  struct Case {
    std::string format;
    M4ALayout layout;
    int rate;
    int channels;
  };
  for (const Case& c :
       {Case{"m4a", M4ALayout::MoovAtEnd, 44100, 1}, Case{"m4a", M4ALayout::MoovFirst, 48000, 2},
        Case{"flac", {}, 44100, 2}, Case{"wav", {}, 22050, 1}}) {
    SCOPED_TRACE(c.format);
    const std::string path = (dir_ / ("tone." + c.format)).string();
    ASSERT_TRUE(writeTone(path, 1.5, c.format, c.rate, c.channels, 1000.0, 0.5, c.layout));
    auto pcm = decodeToPCM(path);
    ASSERT_TRUE(pcm) << pcm.error();
    EXPECT_EQ(pcm->sampleRate, c.rate);
    EXPECT_EQ(pcm->channels, c.channels);
    // AAC adds priming and padding: allow one encoder frame either way.
    EXPECT_NEAR(pcm->seconds(), 1.5, 2048.0 / c.rate);
    const std::size_t mid = pcm->frames() / 2;
    EXPECT_NEAR(estimatedFrequencyHz(*pcm, mid / 2, mid + mid / 2), 1000.0, 5.0);
    EXPECT_NEAR(rms(*pcm, mid / 2, mid + mid / 2), 0.5 / std::sqrt(2.0), 0.02);
  }
}

TEST_F(AudioFixturesTest, LosslessFormatsRoundTripWithinQuantization) {
  const std::string flac = (dir_ / "a.flac").string(), wav = (dir_ / "a.wav").string();
  ASSERT_TRUE(writeTone(flac, 0.5, "flac"));
  ASSERT_TRUE(writeTone(wav, 0.5, "wav"));
  auto a = decodeToPCM(flac), b = decodeToPCM(wav);
  ASSERT_TRUE(a && b);
  EXPECT_EQ(a->frames(), b->frames());
  EXPECT_LE(maxAbsDifference(*a, *b), 1.0 / 32768.0);
}

TEST_F(AudioFixturesTest, DecodingSomethingThatIsNotAudioFails) {
  const std::string path = (dir_ / "text.m4a").string();
  FILE* file = std::fopen(path.c_str(), "w");
  std::fputs("not audio at all\n", file);
  std::fclose(file);
  EXPECT_FALSE(decodeToPCM(path));
  EXPECT_FALSE(decodeToPCM((dir_ / "missing.wav").string()));
  EXPECT_FALSE(writeTone((dir_ / "x.ogg").string(), 1.0, "ogg"));
}

}  // namespace
}  // namespace quorvel::testing

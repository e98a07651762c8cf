// The fixture generator itself: each format decodes back to the tone it was
// asked for, so tests built on it compare against known audio.
#include "tests/support/AudioFixtures.h"

#include <gtest/gtest.h>

#include <cmath>

#include "tests/support/TempDirectory.h"

namespace quorvel::testing {
namespace {

using AudioFixturesTest = TempDirectoryTest;

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
    const std::string file = path("tone." + c.format);
    ASSERT_TRUE(writeTone(file, 1.5, c.format, c.rate, c.channels, 1000.0, 0.5, c.layout));
    auto pcm = decodeToPCM(file);
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

}  // namespace
}  // namespace quorvel::testing

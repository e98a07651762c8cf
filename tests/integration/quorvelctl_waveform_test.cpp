// `quorvelctl waveform URL --png FILE`: the real program draws a waveform file
// written by the framework, and refuses missing and damaged ones.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>

#include "Quorvel/waveform/RCWaveformFile.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {
namespace {

using testing::DaemonProcess;

DaemonProcess::CommandResult draw(std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), {DaemonProcess::programPath("quorvelctl"), "waveform"});
  return DaemonProcess::run(arguments);
}

// Fewer waveform pixels than picture columns (stretched), two channels, and
// one value at full scale: the picture is a PNG of the asked size.
TEST(QuorvelctlWaveformTest, DrawsAPNGOfTheRequestedSize) {
  testing::ScopedTempDir directory;
  RCWaveform waveform(44100, 256, /*channels=*/2);
  for (int pixel = 0; pixel < 100; ++pixel) {
    const std::int16_t value = std::int16_t(pixel * 300);
    std::int16_t pair[4] = {std::int16_t(-value), value, -32768, 32767};
    waveform.appendPixel(pair);
  }
  ASSERT_TRUE(RCWriteWaveformFile(
      waveform, platform::URL::fileURLWithPath((directory / "Walk.waveform").string())));
  const std::string png = directory / "walk.png";
  auto drawn = draw({"file://" + (directory / "Walk.m4a").string(), "--png", png, "--width", "321",
                     "--height", "99"});
  ASSERT_EQ(drawn.status, 0) << drawn.output;
  const std::string bytes = testing::readFile(png);
  ASSERT_GE(bytes.size(), 24u);
  EXPECT_EQ(bytes.substr(0, 8), "\x89PNG\r\n\x1a\n");
  EXPECT_EQ(bytes.substr(12, 4), "IHDR");
  EXPECT_EQ(bytes.substr(16, 8), std::string("\0\0\x01\x41\0\0\0\x63", 8));  // 321 × 99
  EXPECT_FALSE(std::filesystem::exists(png + ".partial"));
}

TEST(QuorvelctlWaveformTest, MissingOrCorruptWaveformIsAnErrorAndWritesNothing) {
  testing::ScopedTempDir directory;
  // A valid header announcing more pixels than the file holds.
  RCWaveform waveform(44100, 256, 1);
  std::int16_t pair[2] = {-5, 5};
  for (int i = 0; i < 10; ++i) waveform.appendPixel(pair);
  const std::string bytes = RCEncodeWaveformFile(waveform);
  testing::writeFile(directory / "Cut.waveform", bytes.substr(0, bytes.size() - 3));
  const std::string png = directory / "out.png";
  for (const auto& [recording, message] : {std::pair{"None.m4a", "has no waveform file"},
                                           {"Cut.m4a", "cannot read the waveform file"}}) {
    auto drawn = draw({directory / recording, "--png", png});
    EXPECT_EQ(drawn.status, 1);
    EXPECT_THAT(drawn.output, ::testing::HasSubstr(message));
  }
  EXPECT_FALSE(std::filesystem::exists(png));
}

}  // namespace
}  // namespace quorvel

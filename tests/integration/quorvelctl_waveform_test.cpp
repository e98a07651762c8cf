// `quorvelctl waveform URL --png FILE`: the real program draws a waveform file
// written by the framework, and refuses missing and damaged ones.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "Quorvel/waveform/RCWaveformFile.h"
#include "tests/support/DaemonProcess.h"

namespace quorvel {
namespace {

using testing::DaemonProcess;
namespace fs = std::filesystem;

std::vector<std::uint8_t> readBytes(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), {}};
}

std::uint32_t bigEndian32(const std::vector<std::uint8_t>& bytes, std::size_t at) {
  return std::uint32_t(bytes[at]) << 24 | std::uint32_t(bytes[at + 1]) << 16 |
         std::uint32_t(bytes[at + 2]) << 8 | bytes[at + 3];
}

class QuorvelctlWaveformTest : public ::testing::Test {
 protected:
  void SetUp() override {
    directory_ = fs::temp_directory_path() / ("quorvel-waveform-" + std::to_string(getpid()));
    fs::remove_all(directory_);
    fs::create_directories(directory_);
  }
  void TearDown() override { fs::remove_all(directory_); }

  DaemonProcess::CommandResult draw(const std::vector<std::string>& arguments) {
    std::vector<std::string> argv{DaemonProcess::programPath("quorvelctl"), "waveform"};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return DaemonProcess::run(argv);
  }

  fs::path directory_;
};

// Fewer waveform pixels than picture columns (stretched), two channels, and
// one value at full scale: the picture is a PNG of the asked size.
TEST_F(QuorvelctlWaveformTest, DrawsAPNGOfTheRequestedSize) {
  RCWaveform waveform(44100, 256, /*channels=*/2);
  for (int pixel = 0; pixel < 100; ++pixel) {
    std::int16_t value = std::int16_t(pixel * 300);
    std::int16_t pair[4] = {std::int16_t(-value), value, -32768, 32767};
    waveform.appendPixel(pair);
  }
  const fs::path audio = directory_ / "Walk.m4a";
  ASSERT_TRUE(RCWriteWaveformFile(
      waveform, platform::URL::fileURLWithPath((directory_ / "Walk.waveform").string())));
  const fs::path png = directory_ / "walk.png";
  auto drawn =
      draw({"file://" + audio.string(), "--png", png.string(), "--width", "321", "--height", "99"});
  ASSERT_EQ(drawn.status, 0) << drawn.output;

  const std::vector<std::uint8_t> bytes = readBytes(png);
  ASSERT_GE(bytes.size(), 24u);
  const std::uint8_t signature[8] = {0x89, 'P', 'N', 'G', '\r', '\n', 0x1a, '\n'};
  EXPECT_TRUE(std::equal(std::begin(signature), std::end(signature), bytes.begin()));
  EXPECT_EQ(std::string(bytes.begin() + 12, bytes.begin() + 16), "IHDR");
  EXPECT_EQ(bigEndian32(bytes, 16), 321u);
  EXPECT_EQ(bigEndian32(bytes, 20), 99u);
  EXPECT_FALSE(fs::exists(png.string() + ".partial"));
}

TEST_F(QuorvelctlWaveformTest, MissingOrCorruptWaveformIsAnErrorAndWritesNothing) {
  const fs::path png = directory_ / "out.png";
  auto missing = draw({(directory_ / "None.m4a").string(), "--png", png.string()});
  EXPECT_EQ(missing.status, 1);
  EXPECT_NE(missing.output.find("has no waveform file"), std::string::npos) << missing.output;

  // A valid header announcing more pixels than the file holds.
  RCWaveform waveform(44100, 256, 1);
  std::int16_t pair[2] = {-5, 5};
  for (int i = 0; i < 10; ++i) waveform.appendPixel(pair);
  std::string bytes = RCEncodeWaveformFile(waveform);
  bytes.resize(bytes.size() - 3);
  std::ofstream(directory_ / "Cut.waveform", std::ios::binary) << bytes;
  auto corrupt = draw({(directory_ / "Cut.m4a").string(), "--png", png.string()});
  EXPECT_EQ(corrupt.status, 1);
  EXPECT_NE(corrupt.output.find("cannot read the waveform file"), std::string::npos)
      << corrupt.output;
  EXPECT_FALSE(fs::exists(png));
}

}  // namespace
}  // namespace quorvel

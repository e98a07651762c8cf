#include "tools/quorvelctl/WaveformPicture.h"

#include <fmt/format.h>
#include <png.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string_view>

#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/files/RCReplacementFile.h"
#include "Quorvel/waveform/RCWaveformFile.h"

namespace quorvelctl {

namespace {

constexpr std::uint8_t kBackground[3] = {0xff, 0xff, 0xff};
constexpr std::uint8_t kAxis[3] = {0xc8, 0xc8, 0xc8};
constexpr std::uint8_t kWave[3] = {0x1f, 0x5f, 0xbf};

constexpr std::uint8_t kText[3] = {0x50, 0x50, 0x50};

void paint(std::vector<std::uint8_t>& pixels, int width, int x, int y, const std::uint8_t* rgb) {
  std::memcpy(&pixels[(std::size_t(y) * width + x) * 3], rgb, 3);
}

// The time axis: a strip of this height under the waveform, when the
// picture is tall enough to spare it.
constexpr int kAxisHeight = 16;
constexpr int kMinimumHeightForAxis = 4 * kAxisHeight;
// Labels are at least this far apart.
constexpr int kMinimumLabelSpacing = 48;

// A 3x5 font for the labels, drawn at twice that size: one row of three
// bits per line, the top line first.
constexpr int kGlyphScale = 2;
constexpr std::uint8_t kGlyphs[][5] = {
    {7, 5, 5, 5, 7}, {2, 6, 2, 2, 7}, {7, 1, 7, 4, 7}, {7, 1, 7, 1, 7},
    {5, 5, 7, 1, 1}, {7, 4, 7, 1, 7}, {7, 4, 7, 5, 7}, {7, 1, 1, 1, 1},
    {7, 5, 7, 5, 7}, {7, 5, 7, 1, 7}, {0, 2, 0, 2, 0},  // ':'
    {0, 3, 6, 3, 6},                                    // 's'
};

const std::uint8_t* glyphFor(char c) {
  if (c >= '0' && c <= '9') return kGlyphs[c - '0'];
  if (c == ':') return kGlyphs[10];
  if (c == 's') return kGlyphs[11];
  return nullptr;
}

// Draws `text` with its left edge at `x` and its top at `y`, clipped to the
// picture.
void drawText(std::vector<std::uint8_t>& pixels, int width, int height, int x, int y,
              std::string_view text) {
  for (char c : text) {
    if (const std::uint8_t* glyph = glyphFor(c)) {
      for (int row = 0; row < 5 * kGlyphScale; ++row) {
        for (int column = 0; column < 3 * kGlyphScale; ++column) {
          const int px = x + column, py = y + row;
          const bool on = glyph[row / kGlyphScale] >> (2 - column / kGlyphScale) & 1;
          if (on && px >= 0 && px < width && py >= 0 && py < height)
            paint(pixels, width, px, py, kText);
        }
      }
    }
    x += 4 * kGlyphScale;
  }
}

// "7s", "45s", "1:30", "12:05": the label of `seconds` on the axis.
std::string timeLabel(int seconds) {
  if (seconds < 60) return fmt::format("{}s", seconds);
  return fmt::format("{}:{:02}", seconds / 60, seconds % 60);
}

// Ticks and labels every so many seconds along the bottom strip: the
// smallest step of 1, 2, 5, 10, 15, 30 s, 1, 2, 5, 10, 15, 30 min… that keeps
// labels apart.
void drawTimeAxis(std::vector<std::uint8_t>& pixels, int width, int height, double seconds) {
  const int top = height - kAxisHeight;
  for (int x = 0; x < width; ++x) paint(pixels, width, x, top, kAxis);
  if (!(seconds > 0)) return;
  const double pixelsPerSecond = width / seconds;
  int step = 1;
  for (int candidate : {1, 2, 5, 10, 15, 30, 60, 120, 300, 600, 900, 1800, 3600, 7200}) {
    step = candidate;
    if (candidate * pixelsPerSecond >= kMinimumLabelSpacing) break;
  }
  for (int t = 0; t <= seconds; t += step) {
    const int x = std::min(int(std::lround(t * pixelsPerSecond)), width - 1);
    for (int y = top; y < top + 3; ++y) paint(pixels, width, x, y, kText);
    const std::string label = timeLabel(t);
    const int textWidth = (int(label.size()) * 4 - 1) * kGlyphScale;
    drawText(pixels, width, height, std::clamp(x - textWidth / 2, 0, width - textWidth), top + 4,
             label);
  }
}

}  // namespace

std::vector<std::uint8_t> renderWaveform(const quorvel::RCWaveform& waveform,
                                         WaveformPictureSize size) {
  const int width = size.width;
  const bool axis = size.height >= kMinimumHeightForAxis;
  const int height = axis ? size.height - kAxisHeight : size.height;  // the waveform's bands
  std::vector<std::uint8_t> pixels(std::size_t(width) * size.height * 3);
  for (std::size_t i = 0; i < pixels.size(); i += 3) std::memcpy(&pixels[i], kBackground, 3);
  if (axis) drawTimeAxis(pixels, width, size.height, waveform.durationSeconds());

  const int channels = std::max(waveform.channels(), 1);
  const std::size_t length = waveform.length();
  // Full scale of the stored values: 8-bit waveforms hold [-128, 127].
  const double fullScale = waveform.bits() == 8 ? 128.0 : 32768.0;
  for (int channel = 0; channel < channels; ++channel) {
    // Band [top, bottom) of this channel; its centre line is silence.
    const int top = channel * height / channels;
    const int bottom = (channel + 1) * height / channels;
    const int bandHeight = bottom - top;
    if (bandHeight <= 0) continue;
    const double centre = top + (bandHeight - 1) / 2.0;
    const double halfHeight = (bandHeight - 1) / 2.0;
    auto rowFor = [&](double value) {
      const double y = centre - std::clamp(value / fullScale, -1.0, 1.0) * halfHeight;
      return std::clamp(int(std::lround(y)), top, bottom - 1);
    };
    for (int x = 0; x < width; ++x) paint(pixels, width, x, rowFor(0), kAxis);
    if (length == 0) continue;
    for (int x = 0; x < width; ++x) {
      // The waveform pixels [first, last) this column covers; at least one.
      std::size_t first = std::size_t(x) * length / width;
      std::size_t last = std::max(std::size_t(x + 1) * length / width, first + 1);
      int low = waveform.min(first, channel);
      int high = waveform.max(first, channel);
      for (std::size_t p = first + 1; p < last; ++p) {
        low = std::min<int>(low, waveform.min(p, channel));
        high = std::max<int>(high, waveform.max(p, channel));
      }
      if (low > high) std::swap(low, high);
      // Image rows grow downwards: the maximum is the upper end.
      for (int y = rowFor(high); y <= rowFor(low); ++y) paint(pixels, width, x, y, kWave);
    }
  }
  return pixels;
}

platform::Status writeWaveformPNG(const quorvel::RCWaveform& waveform, WaveformPictureSize size,
                                  const std::string& path) {
  const std::vector<std::uint8_t> pixels = renderWaveform(waveform, size);
  png_image image;
  std::memset(&image, 0, sizeof image);
  image.version = PNG_IMAGE_VERSION;
  image.width = png_uint_32(size.width);
  image.height = png_uint_32(size.height);
  image.format = PNG_FORMAT_RGB;
  png_alloc_size_t length = 0;
  std::vector<std::uint8_t> bytes;
  bool written = png_image_write_get_memory_size(image, length, /*convert_to_8bit=*/0,
                                                 pixels.data(), /*row_stride=*/0,
                                                 /*colormap=*/nullptr) != 0;
  if (written) {
    bytes.resize(length);
    written =
        png_image_write_to_memory(&image, bytes.data(), &length, 0, pixels.data(), 0, nullptr) != 0;
  }
  const std::string message = image.message;
  png_image_free(&image);
  if (!written) {
    return platform::fail(platform::Error(platform::kPOSIXErrorDomain, EIO,
                                          fmt::format("cannot write {}: {}", path, message)));
  }
  const std::string_view contents(reinterpret_cast<const char*>(bytes.data()), length);
  // A terminal, a pipe or a device is written to as it is; a file is
  // replaced atomically, so a failed write never leaves half a picture
  // under the requested name.
  const quorvel::RCFileStatus existing = quorvel::RCFileStatus::atPathFollowing(path);
  if (existing.exists() && !existing.isRegularFile()) {
    std::FILE* out = std::fopen(path.c_str(), "wb");
    const bool ok = out && std::fwrite(contents.data(), 1, contents.size(), out) == contents.size();
    const int error = errno;
    if (out && std::fclose(out) != 0 && ok)
      return platform::fail(platform::posixError(errno, path));
    if (!ok) return platform::fail(platform::posixError(error, "cannot write " + path));
    return {};
  }
  const auto url = platform::URL::fileURLWithPath(std::filesystem::absolute(path).string());
  return quorvel::RCReplacementFile::replace(url, contents);
}

int drawWaveform(const std::string& text, const std::string& png, WaveformPictureSize size) {
  auto avURL = platform::URL::fromFileURLStringOrPath(text);
  if (!avURL) avURL = platform::URL::fileURLWithPath(text);  // a relative path
  const platform::URL url = quorvel::RCWaveform::waveformURLForAVURL(*avURL);
  std::error_code error;
  if (!std::filesystem::exists(url.path(), error)) {
    std::fprintf(stderr, "quorvelctl: the recording has no waveform file: %s\n",
                 url.path().c_str());
    return 1;
  }
  auto waveform = quorvel::RCReadWaveformFile(url);
  if (!waveform) {
    std::fprintf(stderr, "quorvelctl: cannot read the waveform file %s: %s\n", url.path().c_str(),
                 waveform.error().description().c_str());
    return 1;
  }
  if (auto written = writeWaveformPNG(*waveform, size, png); !written) {
    std::fprintf(stderr, "quorvelctl: %s\n", written.error().localizedDescription().c_str());
    return 1;
  }
  return 0;
}

}  // namespace quorvelctl

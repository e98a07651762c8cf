#include "Quorvel/waveform/RCWaveformFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "Quorvel/errors/RCErrors.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCFileStatus.h"
#include "Quorvel/files/RCReplacementFile.h"

namespace quorvel {
namespace {

constexpr std::uint32_t kFlag8Bit = 1u;
constexpr std::size_t kHeaderSizeV1 = 20;
constexpr std::size_t kHeaderSizeV2 = 24;
// Far beyond any real waveform (a day of stereo 48 kHz audio at the default
// resolution is ~130 MB): a larger file is refused before it is read.
constexpr std::uint64_t kMaxFileSize = std::uint64_t(1) << 30;

void putU32(std::string& out, std::uint32_t value) {
  for (int shift = 0; shift < 32; shift += 8) out.push_back(char((value >> shift) & 0xff));
}

std::uint32_t getU32(const std::uint8_t* p) {
  return std::uint32_t(p[0]) | std::uint32_t(p[1]) << 8 | std::uint32_t(p[2]) << 16 |
         std::uint32_t(p[3]) << 24;
}

platform::Error corrupt(std::string what) {
  return RCMediaError(RCMediaErrorCodeCorruptWaveform, "invalid waveform file: " + what);
}

}  // namespace

std::string RCEncodeWaveformFile(const RCWaveform& waveform) {
  const bool eightBit = waveform.bits() == 8;
  const auto data = waveform.data();
  std::string out;
  out.reserve(kHeaderSizeV2 + data.size() * (eightBit ? 1 : 2));
  putU32(out, std::uint32_t(kRCWaveformFileVersion));
  putU32(out, eightBit ? kFlag8Bit : 0u);
  putU32(out, std::uint32_t(waveform.sampleRate()));
  putU32(out, std::uint32_t(waveform.samplesPerPixel()));
  putU32(out, std::uint32_t(waveform.length()));
  putU32(out, std::uint32_t(waveform.channels()));
  for (const std::int16_t value : data) {
    if (eightBit) {
      out.push_back(char(std::int8_t(value)));
    } else {
      const auto bits = std::uint16_t(value);
      out.push_back(char(bits & 0xff));
      out.push_back(char(bits >> 8));
    }
  }
  return out;
}

platform::Result<RCWaveform> RCDecodeWaveformFile(std::span<const std::uint8_t> bytes) {
  if (bytes.size() < kHeaderSizeV1) return platform::fail(corrupt("shorter than its header"));
  const std::uint8_t* p = bytes.data();
  const auto version = std::int32_t(getU32(p));
  if (version != 1 && version != 2)
    return platform::fail(corrupt(fmt::format("unknown version {}", version)));
  const std::size_t headerSize = version == 1 ? kHeaderSizeV1 : kHeaderSizeV2;
  if (bytes.size() < headerSize) return platform::fail(corrupt("shorter than its header"));
  const std::uint32_t flags = getU32(p + 4);
  const auto sampleRate = std::int32_t(getU32(p + 8));
  const auto samplesPerPixel = std::int32_t(getU32(p + 12));
  const std::uint32_t length = getU32(p + 16);
  const auto channels = version == 1 ? 1 : std::int32_t(getU32(p + 20));
  if (flags & ~kFlag8Bit) return platform::fail(corrupt(fmt::format("unknown flags {:#x}", flags)));
  if (sampleRate < 1) return platform::fail(corrupt(fmt::format("sample rate {}", sampleRate)));
  if (samplesPerPixel < 1)
    return platform::fail(corrupt(fmt::format("samples per pixel {}", samplesPerPixel)));
  if (channels < 1 || channels > kRCWaveformMaxChannels)
    return platform::fail(corrupt(fmt::format("{} channels", channels)));
  const bool eightBit = flags & kFlag8Bit;
  const std::uint64_t valueSize = eightBit ? 1 : 2;
  const std::uint64_t values = std::uint64_t(length) * std::uint64_t(channels) * 2;
  const std::uint64_t expected = headerSize + values * valueSize;
  if (bytes.size() != expected)
    return platform::fail(
        corrupt(fmt::format("{} bytes where {} pixels need {}", bytes.size(), length, expected)));

  RCWaveform waveform(sampleRate, samplesPerPixel, channels, eightBit ? 8 : 16);
  auto& data = waveform.mutableData();
  data.resize(values);
  const std::uint8_t* q = p + headerSize;
  for (std::uint64_t i = 0; i < values; ++i) {
    data[i] = eightBit ? std::int16_t(std::int8_t(q[i]))
                       : std::int16_t(std::uint16_t(q[2 * i] | (q[2 * i + 1] << 8)));
  }
  for (std::uint64_t i = 0; i < values; i += 2) {
    if (data[i] > data[i + 1])
      return platform::fail(
          corrupt(fmt::format("pixel {} has its minimum above its maximum", i / 2 / channels)));
  }
  return waveform;
}

platform::Result<RCWaveform> RCReadWaveformFile(const platform::URL& url) {
  RCScopedFd fd(::open(url.path().c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) return platform::fail(platform::posixError(errno, "cannot open " + url.path()));
  const RCFileStatus status = RCFileStatus::ofDescriptor(fd.get());
  if (!status.isRegularFile()) {
    return platform::fail(corrupt(url.lastPathComponent() + " is not a regular file"));
  }
  const struct stat& info = status.info;
  if (std::uint64_t(info.st_size) > kMaxFileSize) {
    return platform::fail(corrupt(fmt::format("{} bytes is too large", info.st_size)));
  }
  std::vector<std::uint8_t> bytes(std::size_t(info.st_size));
  auto done = RCReadFully(fd.get(), bytes.data(), bytes.size(), url.path());
  if (!done) return platform::fail(done.error());
  bytes.resize(*done);  // shrank while reading: parsed as what is there
  return RCDecodeWaveformFile(bytes);
}

platform::Status RCWriteWaveformFile(const RCWaveform& waveform, const platform::URL& url) {
  return RCReplacementFile::replace(url, RCEncodeWaveformFile(waveform));
}

}  // namespace quorvel

#include "QuorvelMedia/RCWaveformDecoding.h"

#include <algorithm>
#include <optional>

#include "Quorvel/errors/RCErrors.h"
#include "QuorvelMedia/RCAudioDecoder.h"
#include "QuorvelMedia/RCWaveformBuilder.h"

namespace quorvel {

platform::Result<RCWaveform> RCDecodeWaveform(const platform::URL& audio,
                                              const RCWaveformDecoding& decoding) {
  auto opened = RCAudioDecoder::open(audio);
  if (!opened) return platform::fail(opened.error());
  RCAudioDecoder& decoder = **opened;
  const std::string name = audio.lastPathComponent();
  const double declared = decoder.declaredDurationSeconds();
  std::optional<RCWaveformBuilder> builder;
  auto handle = [&](AVFrame* frame) -> platform::Status {
    if (!builder) {
      builder.emplace(frame->sample_rate);
    } else if (frame->sample_rate != builder->waveform().sampleRate()) {
      return platform::fail(
          RCMediaError(RCMediaErrorCodeDecodeFailed, name + " changes its sample rate midway"));
    }
    builder->append(frame);
    if (!decoding.onFrame) return {};
    const double seconds = double(builder->framesAppended()) / frame->sample_rate;
    return decoding.onFrame(*builder, declared > 0 ? seconds / declared : 0.0);
  };
  if (auto decoded = decoder.decodeAll(handle, decoding.cancelled); !decoded)
    return platform::fail(decoded.error());
  if (!builder || builder->framesAppended() == 0) {
    return platform::fail(
        RCMediaError(RCMediaErrorCodeDecodeFailed, "no audio could be decoded from " + name));
  }
  const int rate = builder->waveform().sampleRate();
  const double decodedSeconds = double(builder->framesAppended()) / rate;
  // Decoders round up to whole codec frames; anything shorter than the
  // declared duration by more than a few frames is missing audio.
  if (declared > 0 && decodedSeconds < declared - std::max(0.05, 4096.0 / rate)) {
    return platform::fail(RCMediaError(RCMediaErrorCodeTruncated,
                                       fmt::format("{} holds {:.3f}s of audio but declares {:.3f}s",
                                                   name, decodedSeconds, declared)));
  }
  builder->finish();
  return builder->waveform();
}

}  // namespace quorvel

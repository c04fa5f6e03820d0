// Video and audio intake: one captured NDI frame into one host buffer.
//
// Video: the frame is checked, its FourCC mapped to the host's picture code,
// a buffer of that format requested and the picture copied once, straight
// from the runtime's frame. Audio: the runtime interleaves its planar float
// samples straight into the host buffer. Both share the timestamp base: the
// smallest sender timestamp seen since Start is time 0, and a frame older
// than that moves the base and resets the host's clock.
//
// Limits of what a frame may describe: width and height travel to the host as
// signed 16-bit values (at most 32767), the channel count as one byte that is
// read as signed wherever a size is computed (at most 127); larger frames are
// dropped before any buffer is requested. Sound of too many channels is told
// once, when it starts (again after a change of count or after sound that was
// taken), not with every frame, and the panel's audio line says why there is
// no sound. A line stride smaller than one row of the picture (or negative)
// would make the copy read past the runtime's frame; such frames are dropped
// as well.

#include <cstdint>
#include <limits>

#include "pm/runtime/log.h"
#include "pm/shm/formats.h"
#include "taskndisource/ndi_source.h"

namespace TaskNDISource {

namespace {

constexpr std::int32_t kMaxDimension = 32767;
constexpr std::int32_t kMaxChannels = 127;

struct RasterFormat {
  std::uint32_t code = 0;
  std::int32_t bytesPerPixel = 0;  // of the first plane's rows
};

// The host picture code of an NDI FourCC; code 0 when the FourCC is not taken.
RasterFormat RasterFromFourCC(std::uint32_t fourcc) {
  if (fourcc == kNdiFourCCUYVY || fourcc == kNdiFourCCUYVA) return {pm::kCode2vuy, 2};  // UYVA: alpha not carried
  if (fourcc == kNdiFourCCNV12) return {pm::kCodeNV12, 1};
  if (fourcc == kNdiFourCCBGRA) return {pm::kCodeRgba, 4};
  return {};
}

}  // namespace

std::int64_t TicksFrom100ns(std::int64_t difference) {
  __extension__ typedef __int128 Wide;
  const Wide ticks = static_cast<Wide>(difference) * 100 * 441 / 625;
  if (ticks > std::numeric_limits<std::int64_t>::max()) return std::numeric_limits<std::int64_t>::max();
  if (ticks < std::numeric_limits<std::int64_t>::min()) return std::numeric_limits<std::int64_t>::min();
  return static_cast<std::int64_t>(ticks);
}

std::int64_t NDISource::TakeTimestamp(std::int64_t timestamp, bool* reset) {
  // A new base stays taken even when its frame is dropped later on; the
  // host's clock is then reset with the next frame that is delivered.
  if (timestamp != 0 && timestamp < timestampBase_) {
    timestampBase_ = timestamp;
    resetPending_ = true;
  }
  *reset = resetPending_;
  if (timestamp == 0) return 0;
  std::int64_t difference = 0;
  if (__builtin_sub_overflow(timestamp, timestampBase_, &difference)) {
    difference = std::numeric_limits<std::int64_t>::max();
  }
  return difference;
}

void NDISource::MarkProduced(std::uint32_t bit) {
  if ((producesMask_ & bit) != 0) return;
  producesMask_ |= bit;
  GetCallbacks()->UpdateProduction(producesMask_);
}

bool NDISource::ProcessVideoFrame(const ndi_video_frame_v2& frame, MediaInfo* info) {
  const std::shared_ptr<Callbacks>& callbacks = GetCallbacks();
  if (!callbacks) {
    pm::LogText(kLogTag, "expected video data callback when processing NDI video frame");
    return false;
  }
  if (frame.data == nullptr) {
    pm::LogText(kLogTag, "null data in NDI video frame");
    return false;
  }
  if (frame.line_stride_in_bytes == 0) {
    pm::LogText(kLogTag, "invalid stride in NDI video frame");
    return false;
  }
  if (frame.xres <= 0 || frame.yres <= 0) {
    pm::LogText(kLogTag, "invalid resolution in NDI video frame");
    return false;
  }
  if (frame.xres > kMaxDimension || frame.yres > kMaxDimension) {
    pm::Log(pm::LogType::Normal, kLogTag, "NDI video frame too large (%dx%d)", frame.xres, frame.yres);
    return false;
  }
  const RasterFormat raster = RasterFromFourCC(frame.FourCC);
  if (raster.code != 0 &&
      std::int64_t{frame.line_stride_in_bytes} < std::int64_t{frame.xres} * raster.bytesPerPixel) {
    pm::LogText(kLogTag, "invalid stride in NDI video frame");
    return false;
  }

  bool reset = false;
  const std::int64_t difference = TakeTimestamp(frame.timestamp, &reset);

  if (raster.code == 0) {
    pm::LogText(kLogTag, "unexpected raster format");
    return false;
  }

  pm::VideoFormat format;
  format.code = raster.code;
  format.width = static_cast<std::int16_t>(frame.xres);
  format.height = static_cast<std::int16_t>(frame.yres);
  format.byteSize = 0;
  format.field = 0;
  format.scan = frame.frame_format_type == kNdiFrameFormatProgressive ? pm::kScanProgressive : pm::kScanOther;
  std::shared_ptr<pm::VideoBuffer> buffer = callbacks->RequestVideoBuffer(format, 0);
  if (!buffer) {
    pm::LogText(kLogTag, "video well ran dry");
    return false;
  }
  // The copy reads a picture of the buffer's format from the frame: a buffer
  // of any other format would read past it.
  const pm::VideoFormat given = buffer->Format();
  if (given.code != format.code || given.width != format.width || given.height != format.height) {
    pm::LogText(kLogTag, "video buffer does not match the NDI video frame");
    return false;
  }
  buffer->CopyFrame(frame.data, frame.line_stride_in_bytes);

  if (reset) {
    resetPending_ = false;
    callbacks->TimestampReset();
  }
  MarkProduced(1);
  callbacks->SendVideoBuffer(TicksFrom100ns(difference), std::move(buffer));

  if (info != nullptr) {
    info->videoWidth = frame.xres;
    info->videoHeight = frame.yres;
    info->frameRateN = frame.frame_rate_N;
    info->frameRateD = frame.frame_rate_D;
  }
  return true;
}

bool NDISource::ProcessAudioFrame(const ndi_audio_frame_v2& frame, MediaInfo* info) {
  const std::shared_ptr<Callbacks>& callbacks = GetCallbacks();
  if (!callbacks) {
    pm::LogText(kLogTag, "no callbacks");
    return false;
  }
  if (frame.sample_rate <= 0) {
    pm::LogText(kLogTag, "unexpected audio sample rate");
    return false;
  }
  if (frame.no_samples <= 0) {
    pm::LogText(kLogTag, "unexpected audio sample count");
    return false;
  }
  if (frame.no_channels <= 0) {
    pm::LogText(kLogTag, "unexpected audio channel count");
    return false;
  }
  if (frame.data == nullptr) {
    pm::LogText(kLogTag, "null audio sample data");
    return false;
  }
  if (frame.no_channels > kMaxChannels) {
    if (refusedChannels_ != frame.no_channels) {
      refusedChannels_ = frame.no_channels;
      pm::Log(pm::LogType::Normal, kLogTag,
              "too many channels in NDI audio frame (%d): at most %d are carried, its sound is dropped",
              frame.no_channels, kMaxChannels);
    }
    if (info != nullptr) {
      info->audioSampleRate = frame.sample_rate;
      info->audioChannels = frame.no_channels;
      info->audioRefused = true;
    }
    return false;
  }

  bool reset = false;
  const std::int64_t difference = TakeTimestamp(frame.timestamp, &reset);

  pm::AudioFormat format;
  format.code = pm::kCodeFl32;
  format.sampleRate = static_cast<std::uint32_t>(frame.sample_rate);
  format.channels = static_cast<std::uint8_t>(frame.no_channels);
  std::shared_ptr<pm::AudioBuffer> buffer = callbacks->RequestAudioBuffer(format, frame.no_samples);
  if (!buffer) {
    pm::LogText(kLogTag, "audio well ran dry");
    return false;
  }
  // The runtime writes channels x samples floats; a buffer smaller than that
  // is left untouched rather than written past.
  const std::int64_t needed = std::int64_t{frame.no_channels} * frame.no_samples * std::int64_t{sizeof(float)};
  bool filled = false;
  buffer->Fill([&](void* data, std::int64_t byteSize) {
    if (data == nullptr || byteSize < needed) return;
    ndi_audio_frame_interleaved_32f destination{};
    destination.sample_rate = frame.sample_rate;
    destination.no_channels = frame.no_channels;
    destination.no_samples = frame.no_samples;
    destination.timecode = kNdiSendTimecodeSynthesize;
    destination.data = static_cast<float*>(data);
    api_->util_audio_to_interleaved_32f_v2(&frame, &destination);
    filled = true;
  });
  if (!filled) {
    pm::LogText(kLogTag, "audio buffer too small for the NDI audio frame");
    return false;
  }

  if (reset) {
    resetPending_ = false;
    callbacks->TimestampReset();
  }
  MarkProduced(2);
  callbacks->SendAudioBuffer(TicksFrom100ns(difference), std::move(buffer));

  refusedChannels_ = 0;
  if (info != nullptr) {
    info->audioSampleRate = frame.sample_rate;
    info->audioChannels = frame.no_channels;
    info->audioRefused = false;
  }
  return true;
}

}  // namespace TaskNDISource

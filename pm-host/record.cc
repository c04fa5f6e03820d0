#include "pm-host/record.h"

#include <cstring>

#include "pm/runtime/little_endian.h"

namespace pmhost {

namespace {

bool IsPictureCode(std::uint32_t code) {
  return code == pm::kCode2vuy || code == pm::kCodeYuvs || code == pm::kCodeNV12 || code == pm::kCodeRgba;
}

bool IsSampleCode(std::uint32_t code) { return code == pm::kCodeFl32 || code == pm::kCodeSowt; }

}  // namespace

std::string CodeText(std::uint32_t code) {
  std::string text(4, '?');
  for (int i = 0; i < 4; ++i) {
    const auto c = static_cast<unsigned char>(code >> (24 - 8 * i));
    if (c >= 0x20 && c < 0x7F) text[static_cast<std::size_t>(i)] = static_cast<char>(c);
  }
  return text;
}

bool ParseRecord(const std::uint8_t* wire, std::size_t length, QueueRecord* out, std::string* reason) {
  *out = QueueRecord{};
  if (wire == nullptr || length < pm::kQueueTokenBytes) {
    *reason = "record of " + std::to_string(length) + " bytes has no token";
    return false;
  }
  out->token = pm::LoadLe32(wire);
  if (length != pm::kQueueWireRecordBytes) {
    *reason = "record of " + std::to_string(length) + " bytes instead of 64";
    return false;
  }
  const std::uint8_t* recordBytes = wire + pm::kQueueTokenBytes;
  const pm::FletcherSums sums = pm::Fletcher16(recordBytes, pm::kQueueRecordBytes);
  if (sums.sum1 != 0 || sums.sum2 != 0) {
    *reason = "check sums " + std::to_string(sums.sum1) + "/" + std::to_string(sums.sum2) + " instead of 0/0";
    return false;
  }
  pm::PackedQueueRecord record;
  std::memcpy(&record, recordBytes, sizeof record);
  out->descriptor = record.descriptor;
  const pm::BufferDescriptor& d = out->descriptor;
  if (d.type != pm::kCpuMemoryType) {
    *reason = "segment type " + CodeText(d.type) + " is not a CPU segment";
    return false;
  }
  if (d.size == 0 || d.size > kMaxSegmentBytes) {
    *reason = "segment size " + std::to_string(d.size) + " out of range";
    return false;
  }
  const auto head = pm::PayloadAs<pm::PayloadHead>(record);
  out->mediaTime = head.mediaTime;
  const std::uint32_t code = head.code;

  if (IsPictureCode(code)) {
    out->kind = RecordKind::Video;
    out->video = pm::PayloadAs<pm::VideoPayload>(record).format;
    const pm::VideoFormat& f = out->video;
    if (f.width <= 0 || f.height <= 0) {
      *reason = "picture of " + std::to_string(f.width) + "x" + std::to_string(f.height);
      return false;
    }
    const std::uint64_t minimumStride = static_cast<std::uint64_t>(pm::DefaultStride(f));
    const std::uint64_t stride = d.stride == 0 ? minimumStride : d.stride;
    if (stride < minimumStride) {
      *reason = "stride " + std::to_string(stride) + " shorter than a row of " + std::to_string(minimumStride);
      return false;
    }
    std::uint64_t bytes = static_cast<std::uint64_t>(f.height) * stride;
    if (code == pm::kCodeNV12) bytes = bytes * 3 / 2;
    if (bytes > d.size) {
      *reason = CodeText(code) + " picture of " + std::to_string(bytes) + " bytes in a segment of " +
                std::to_string(d.size);
      return false;
    }
    out->stride = static_cast<std::uint32_t>(stride);
    out->frameBytes = bytes;
    return true;
  }
  if (IsSampleCode(code)) {
    out->kind = RecordKind::Audio;
    const auto audio = pm::PayloadAs<pm::AudioPayload>(record);
    out->audio.code = code;
    out->samples = audio.samples;
    out->audio.sampleRate = audio.sampleRate;
    out->audio.channels = audio.channels;
    const auto channels = static_cast<std::int8_t>(audio.channels);
    if (out->samples <= 0 || out->audio.sampleRate == 0 || channels <= 0) {
      *reason = "sound of " + std::to_string(out->samples) + " samples, " + std::to_string(channels) +
                " channels at " + std::to_string(out->audio.sampleRate) + " Hz";
      return false;
    }
    const std::uint64_t bytes = static_cast<std::uint64_t>(out->samples) * static_cast<std::uint64_t>(channels) *
                                static_cast<std::uint64_t>(pm::BytesPerSample(code));
    if (bytes > d.size) {
      *reason = "sound of " + std::to_string(bytes) + " bytes in a segment of " + std::to_string(d.size);
      return false;
    }
    out->frameBytes = bytes;
    return true;
  }
  *reason = "unknown code " + CodeText(code);
  return false;
}

}  // namespace pmhost

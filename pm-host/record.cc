#include "pm-host/record.h"

#include <cstring>

namespace pmhost {

namespace {

template <class T>
T GetLE(const std::uint8_t* p) {
  T value{};
  std::memcpy(&value, p, sizeof value);  // the wire and this host are little-endian
  return value;
}

bool IsPictureCode(std::uint32_t code) {
  return code == pm::kCode2vuy || code == pm::kCodeYuvs || code == pm::kCodeNV12 || code == pm::kCodeRgba;
}

bool IsSampleCode(std::uint32_t code) { return code == pm::kCodeFl32 || code == pm::kCodeSowt; }

}  // namespace

FletcherSums Fletcher16(const std::uint8_t* bytes, std::size_t length) {
  FletcherSums sums;
  for (std::size_t i = 0; i < length; ++i) {
    sums.sum1 = (sums.sum1 + bytes[i]) % 255;
    sums.sum2 = (sums.sum2 + sums.sum1) % 255;
  }
  return sums;
}

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
  if (wire == nullptr || length < 4) {
    *reason = "record of " + std::to_string(length) + " bytes has no token";
    return false;
  }
  out->token = GetLE<std::uint32_t>(wire);
  if (length != kWireRecordBytes) {
    *reason = "record of " + std::to_string(length) + " bytes instead of 64";
    return false;
  }
  const std::uint8_t* record = wire + 4;
  const FletcherSums sums = Fletcher16(record, kRecordBytes);
  if (sums.sum1 != 0 || sums.sum2 != 0) {
    *reason = "check sums " + std::to_string(sums.sum1) + "/" + std::to_string(sums.sum2) + " instead of 0/0";
    return false;
  }
  std::memcpy(&out->descriptor, record, sizeof(pm::BufferDescriptor));
  const pm::BufferDescriptor& d = out->descriptor;
  if (d.type != pm::kCpuMemoryType) {
    *reason = "segment type " + CodeText(d.type) + " is not a CPU segment";
    return false;
  }
  if (d.size == 0 || d.size > kMaxSegmentBytes) {
    *reason = "segment size " + std::to_string(d.size) + " out of range";
    return false;
  }
  const std::uint8_t* payload = record + 24;
  out->mediaTime = GetLE<std::int64_t>(payload);
  const auto code = GetLE<std::uint32_t>(payload + 8);

  if (IsPictureCode(code)) {
    out->kind = RecordKind::Video;
    std::memcpy(&out->video, payload + 8, sizeof(pm::VideoFormat));
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
    out->audio.code = code;
    out->samples = GetLE<std::int32_t>(payload + 12);
    out->audio.sampleRate = GetLE<std::uint32_t>(payload + 16);
    out->audio.channels = payload[20];
    const auto channels = static_cast<std::int8_t>(payload[20]);
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

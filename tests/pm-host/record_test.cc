// The host's record reader against hostile bytes: check sums, short and
// garbage input, sizes beyond the segment, and segments that cannot be
// mapped. Every refused record still yields its token.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>
#include <random>

#include "pm-host/queue_reader.h"
#include "pm-host/record.h"
#include "pm/shm/queue_record.h"
#include "support/log_capture.h"

namespace {

using pmhost::ParseRecord;
using pmhost::QueueRecord;

struct Wire {
  std::uint8_t bytes[64] = {};
};

// A record as the task writes it: token, descriptor, payload, check bytes.
Wire VideoRecord(std::uint32_t token, std::uint64_t size, std::uint32_t stride, std::uint32_t code, std::int16_t width,
                 std::int16_t height, std::int64_t mediaTime = 0) {
  Wire w;
  std::memcpy(w.bytes, &token, 4);
  pm::BufferDescriptor d;
  d.type = pm::kCpuMemoryType;
  d.size = size;
  d.stride = stride;
  std::memcpy(w.bytes + 4, &d, sizeof d);
  pm::VideoFormat f;
  f.code = code;
  f.width = width;
  f.height = height;
  f.scan = pm::kScanProgressive;
  std::memcpy(w.bytes + 28, &mediaTime, 8);
  std::memcpy(w.bytes + 36, &f, sizeof f);
  std::memcpy(w.bytes + 62, pm::FletcherCheckBytes(w.bytes + 4, 58).data(), 2);
  return w;
}

Wire AudioRecord(std::uint32_t token, std::uint64_t size, std::uint32_t code, std::int32_t samples, std::uint32_t rate,
                 std::uint8_t channels) {
  Wire w;
  std::memcpy(w.bytes, &token, 4);
  pm::BufferDescriptor d;
  d.type = pm::kCpuMemoryType;
  d.size = size;
  d.stride = 1;
  std::memcpy(w.bytes + 4, &d, sizeof d);
  std::memcpy(w.bytes + 36, &code, 4);
  std::memcpy(w.bytes + 40, &samples, 4);
  std::memcpy(w.bytes + 44, &rate, 4);
  w.bytes[48] = channels;
  std::memcpy(w.bytes + 62, pm::FletcherCheckBytes(w.bytes + 4, 58).data(), 2);
  return w;
}

TEST(RecordReader, ReadsTheFieldsOfSoundRecords) {
  QueueRecord r;
  std::string why;
  Wire v = VideoRecord(7, 8192, 0, pm::kCodeNV12, 64, 32, 123456789);
  ASSERT_TRUE(ParseRecord(v.bytes, 64, &r, &why)) << why;
  EXPECT_EQ(r.token, 7u);
  EXPECT_EQ(r.kind, pmhost::RecordKind::Video);
  EXPECT_EQ(r.mediaTime, 123456789);
  EXPECT_EQ(r.stride, 64u);  // 0 stands for the default stride
  EXPECT_EQ(r.frameBytes, 64u * 32 * 3 / 2);

  Wire a = AudioRecord(9, 4096, pm::kCodeFl32, 480, 48000, 2);
  ASSERT_TRUE(ParseRecord(a.bytes, 64, &r, &why)) << why;
  EXPECT_EQ(r.kind, pmhost::RecordKind::Audio);
  EXPECT_EQ(r.samples, 480);
  EXPECT_EQ(r.frameBytes, 3840u);
}

TEST(RecordReader, RefusesEveryFlippedByteThroughTheCheckSums) {
  const Wire good = VideoRecord(3, 8192, 128, pm::kCode2vuy, 64, 32);
  for (int i = 4; i < 64; ++i) {
    Wire bad = good;
    bad.bytes[i] ^= 0x01;
    QueueRecord r;
    std::string why;
    EXPECT_FALSE(ParseRecord(bad.bytes, 64, &r, &why)) << "byte " << i;
    EXPECT_NE(why.find("check sums"), std::string::npos) << why;
    EXPECT_EQ(r.token, 3u);  // still returned to the task
  }
}

TEST(RecordReader, RefusesSizesAndShapesTheSegmentCannotHold) {
  struct Case {
    const char* what;
    Wire wire;
  } cases[] = {
      {"picture larger than the segment", VideoRecord(1, 4096, 0, pm::kCode2vuy, 64, 64)},
      {"stride shorter than a row", VideoRecord(1, 1 << 20, 100, pm::kCode2vuy, 64, 8)},
      {"negative width", VideoRecord(1, 1 << 20, 0, pm::kCode2vuy, -64, 8)},
      {"zero height", VideoRecord(1, 1 << 20, 0, pm::kCodeRgba, 64, 0)},
      {"NV12 chroma beyond the segment", VideoRecord(1, 64 * 64, 0, pm::kCodeNV12, 64, 64)},
      {"unknown code", VideoRecord(1, 1 << 20, 0, 0x41424344, 64, 8)},
      {"JPEG", VideoRecord(1, 1 << 20, 0, pm::kCodeJpeg, 64, 8)},
      {"segment of 0 bytes", VideoRecord(1, 0, 0, pm::kCode2vuy, 2, 2)},
      {"segment beyond the limit", VideoRecord(1, std::uint64_t{1} << 40, 0, pm::kCode2vuy, 2, 2)},
      {"sound larger than the segment", AudioRecord(1, 4096, pm::kCodeFl32, 1024, 48000, 2)},
      {"negative channel count", AudioRecord(1, 4096, pm::kCodeFl32, 16, 48000, 0xFF)},
      {"no samples", AudioRecord(1, 4096, pm::kCodeSowt, 0, 48000, 2)},
      {"rate 0", AudioRecord(1, 4096, pm::kCodeSowt, 16, 0, 2)},
  };
  for (const Case& c : cases) {
    QueueRecord r;
    std::string why;
    EXPECT_FALSE(ParseRecord(c.wire.bytes, 64, &r, &why)) << c.what;
    EXPECT_FALSE(why.empty()) << c.what;
  }
}

TEST(RecordReader, ShortAndGarbageInputNeverReadsPastTheBytes) {
  QueueRecord r;
  std::string why;
  EXPECT_FALSE(ParseRecord(nullptr, 0, &r, &why));
  const std::uint8_t three[3] = {1, 2, 3};
  EXPECT_FALSE(ParseRecord(three, 3, &r, &why));
  const Wire good = VideoRecord(5, 8192, 0, pm::kCode2vuy, 8, 8);
  EXPECT_FALSE(ParseRecord(good.bytes, 63, &r, &why));
  EXPECT_EQ(r.token, 5u);
  // All zeros passes the check sums but names no segment.
  const std::uint8_t zeros[64] = {};
  EXPECT_FALSE(ParseRecord(zeros, 64, &r, &why));
  std::mt19937 random(42);
  int accepted = 0;
  for (int i = 0; i < 20000; ++i) {
    std::uint8_t bytes[64];
    for (auto& b : bytes) b = static_cast<std::uint8_t>(random());
    if (ParseRecord(bytes, 64, &r, &why)) {
      ++accepted;
      EXPECT_LE(r.frameBytes, r.descriptor.size);
    }
  }
  EXPECT_LT(accepted, 5);
}

// A reader without a connection: Handle is the reader thread's step.
class ReaderWithSegment : public ::testing::Test {
 protected:
  void SetUp() override {
    base_ = "pmhost-test-" + std::to_string(::getpid()) + "-";
    const int fd = ::shm_open(("/" + base_ + "4").c_str(), O_CREAT | O_RDWR, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(::ftruncate(fd, 4096), 0);
    ::close(fd);
  }
  void TearDown() override { ::shm_unlink(("/" + base_ + "4").c_str()); }
  std::string base_;
};

struct CountingSink : pmhost::FrameSink {
  void OnVideo(const std::string&, const pmhost::VideoFrame& f) override {
    ++videos;
    lastBytes = f.bytes;
  }
  void OnAudio(const std::string&, const pmhost::AudioFrame&) override { ++audios; }
  void OnBadRecord(const std::string&, const std::string&) override { ++bad; }
  int videos = 0, audios = 0, bad = 0;
  std::uint64_t lastBytes = 0;
};

TEST_F(ReaderWithSegment, SkipsRecordsItCannotMapAndStillReturnsTheirTokens) {
  pmtest::LogCapture log;
  CountingSink sink;
  pmhost::QueueReader reader("src", base_, &sink);
  std::uint32_t token = 0;
  Wire ok = VideoRecord(4, 4096, 0, pm::kCode2vuy, 32, 16);
  EXPECT_TRUE(reader.Handle(ok.bytes, 64, &token));
  EXPECT_EQ(token, 4u);
  EXPECT_EQ(sink.videos, 1);
  EXPECT_EQ(sink.lastBytes, 32u * 2 * 16);

  // The record claims more bytes than the segment has: mapping them would
  // fault on reading.
  Wire tooBig = VideoRecord(4, 8192, 0, pm::kCode2vuy, 32, 16);
  EXPECT_TRUE(reader.Handle(tooBig.bytes, 64, &token));
  EXPECT_EQ(token, 4u);
  Wire missing = VideoRecord(5, 4096, 0, pm::kCode2vuy, 32, 16);
  EXPECT_TRUE(reader.Handle(missing.bytes, 64, &token));
  EXPECT_EQ(token, 5u);
  Wire bad = ok;
  bad.bytes[10] ^= 0x01;  // (0x00 and 0xFF are the same to sums mod 255)
  EXPECT_TRUE(reader.Handle(bad.bytes, 64, &token));
  EXPECT_EQ(token, 4u);
  EXPECT_EQ(sink.videos, 1);
  EXPECT_EQ(sink.bad, 3);
  EXPECT_EQ(reader.BadRecords(), 3u);
  EXPECT_EQ(log.Count("record skipped"), 3);
}

TEST(RecordReader, AMemoryBaseThatCouldEscapeTheSegmentFolderMapsNothing) {
  pmtest::LogCapture log;
  CountingSink sink;
  pmhost::QueueReader reader("src", "../etc/", &sink);
  std::uint32_t token = 0;
  Wire ok = VideoRecord(1, 4096, 0, pm::kCode2vuy, 32, 16);
  EXPECT_TRUE(reader.Handle(ok.bytes, 64, &token));
  EXPECT_EQ(sink.videos, 0);
  EXPECT_EQ(sink.bad, 1);
}

}  // namespace

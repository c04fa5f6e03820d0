// The host's record reader against hostile bytes: check sums, short input,
// sizes and shapes the segment cannot hold, segments that cannot be mapped and
// a memory base that could leave /dev/shm. Every refused record is counted,
// logged once and still yields its token. And the host's segments: a size
// change remaps, a segment shorter than its record is refused, and a crashed
// runner's segments are removed by prefix only. The queue side itself
// (records decoded as written, tokens back so segments are reused) runs in
// every whole-chain case of tests/faults and tests/pm-host;
// "::delete_memory" comes only with compressed pictures, which the host
// refuses.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <memory>
#include <tuple>

#include "pm-host/queue_reader.h"
#include "pm-host/segments.h"
#include "pm/shm/queue_record.h"
#include "support/log_capture.h"

namespace {

using Wire = std::vector<std::uint8_t>;

// Segments of this test process, made by hand.
struct Segment {
  Segment(const std::string& name, std::size_t size, std::uint8_t fill) : name(name) {
    const int fd = ::shm_open(name.c_str(), O_CREAT | O_RDWR, 0600);
    EXPECT_GE(fd, 0);
    EXPECT_EQ(::ftruncate(fd, static_cast<off_t>(size)), 0);
    void* p = ::mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    std::memset(p, fill, size);
    ::munmap(p, size);
    ::close(fd);
  }
  ~Segment() { ::shm_unlink(name.c_str()); }
  std::string name;
};

std::string Base() { return "pmhost-cache-" + std::to_string(::getpid()) + "-"; }

// A record as the task writes it: token, then the sealed record.
Wire Sealed(std::uint32_t token, std::uint64_t size, std::uint32_t stride, const void* payload, std::size_t n) {
  pm::PackedQueueRecord r;
  r.descriptor.type = pm::kCpuMemoryType;
  r.descriptor.size = size;
  r.descriptor.stride = stride;
  std::memcpy(r.payload, payload, n);
  pm::SealQueueRecord(r);
  Wire w(pm::kQueueWireRecordBytes);
  std::memcpy(w.data(), &token, 4);
  std::memcpy(w.data() + 4, &r, sizeof r);
  return w;
}

Wire Video(std::uint32_t token, std::uint64_t size, std::uint32_t stride, std::uint32_t code, std::int16_t width,
           std::int16_t height) {
  const pm::VideoPayload p{
      .mediaTime = 123456789, .format = {.code = code, .width = width, .height = height, .scan = pm::kScanProgressive}};
  return Sealed(token, size, stride, &p, sizeof p);
}

Wire Audio(std::uint32_t token, std::uint64_t size, std::uint32_t code, std::int32_t samples, std::uint32_t rate,
           std::uint8_t channels) {
  const pm::AudioPayload p{.code = code, .samples = samples, .sampleRate = rate, .channels = channels};
  return Sealed(token, size, 1, &p, sizeof p);
}

struct CountingSink : pmhost::FrameSink {
  void OnVideo(const std::string&, const pmhost::VideoFrame&) override { ++frames; }
  void OnAudio(const std::string&, const pmhost::AudioFrame&) override { ++frames; }
  void OnBadRecord(const std::string&, const std::string&) override { ++bad; }
  int frames = 0, bad = 0;
};

// The reader's step (Handle) against segment 4 of 4096 bytes, made here.
TEST(RecordRefusals, EveryRefusedRecordIsSkippedWithItsReasonAndItsTokenReturned) {
  const Segment segment("/" + Base() + "4", 4096, 0);
  struct Case {
    std::string what;
    Wire wire;
    std::string reason;  // a text of the logged reason
    std::size_t length = pm::kQueueWireRecordBytes;
    std::string base = "";  // "" this case's base
  };
  std::vector<Case> cases = {
      {"picture larger than the segment", Video(4, 4096, 0, pm::kCode2vuy, 64, 64), "bytes in a segment of 4096"},
      {"stride shorter than a row", Video(4, 4096, 100, pm::kCode2vuy, 64, 8), "stride 100 shorter than a row"},
      {"negative width", Video(4, 4096, 0, pm::kCode2vuy, -64, 8), "picture of -64x8"},
      {"zero height", Video(4, 4096, 0, pm::kCodeRgba, 64, 0), "picture of 64x0"},
      {"NV12 chroma beyond the segment", Video(4, 32 * 32, 0, pm::kCodeNV12, 32, 32), "bytes in a segment of 1024"},
      {"unknown code", Video(4, 4096, 0, 0x41424344, 64, 8), "unknown code"},
      {"JPEG", Video(4, 4096, 0, pm::kCodeJpeg, 64, 8), "unknown code"},
      {"segment of 0 bytes", Video(4, 0, 0, pm::kCode2vuy, 2, 2), "out of range"},
      {"segment beyond the limit", Video(4, std::uint64_t{1} << 40, 0, pm::kCode2vuy, 2, 2), "out of range"},
      {"sound larger than the segment", Audio(4, 4096, pm::kCodeFl32, 1024, 48000, 2), "bytes in a segment of 4096"},
      {"negative channel count", Audio(4, 4096, pm::kCodeFl32, 16, 48000, 0xFF), "-1 channels"},
      {"no samples", Audio(4, 4096, pm::kCodeSowt, 0, 48000, 2), "sound of 0 samples"},
      {"rate 0", Audio(4, 4096, pm::kCodeSowt, 16, 0, 2), "at 0 Hz"},
      {"all zeros: sums of 0, but no segment", Wire(64, 0), "not a CPU segment"},
      {"one byte short", Video(4, 4096, 0, pm::kCode2vuy, 8, 8), "instead of 64", 63},
      // Parsed, but mapping them would fault on reading or finds nothing.
      {"more bytes than the segment has", Video(4, 8192, 0, pm::kCode2vuy, 32, 16), "cannot be mapped"},
      {"no such segment", Video(5, 4096, 0, pm::kCode2vuy, 32, 16), "cannot be mapped"},
      {"a base that could escape /dev/shm", Video(4, 4096, 0, pm::kCode2vuy, 32, 16), "cannot be mapped", 64,
       "../etc/"},
  };
  // Every byte after the token flipped (0x00 and 0xFF are the same to sums
  // mod 255, so one bit).
  for (std::size_t i = 4; i < pm::kQueueWireRecordBytes; ++i) {
    cases.push_back({"byte " + std::to_string(i) + " flipped", Video(4, 4096, 0, pm::kCode2vuy, 32, 16), "check sums"});
    cases.back().wire[i] ^= 0x01;
  }
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    pmtest::LogCapture log;
    CountingSink sink;
    pmhost::QueueReader reader("src", c.base.empty() ? Base() : c.base, &sink);
    std::uint32_t token = 0;
    EXPECT_TRUE(reader.Handle(c.wire.data(), c.length, &token));
    std::uint32_t sent = 0;
    std::memcpy(&sent, c.wire.data(), 4);
    EXPECT_EQ(token, sent) << "the token still goes back";
    // Nothing handed on; one bad record told, counted and logged.
    EXPECT_EQ(std::make_tuple(sink.frames, sink.bad, reader.BadRecords(), log.Count("record skipped: ")),
              std::make_tuple(0, 1, std::uint64_t{1}, 1));
    EXPECT_EQ(log.Count(c.reason), 1) << c.reason << " not in " << ::testing::PrintToString(log.Lines());
  }
  // Fewer than the token's bytes: nothing to give back, nothing read.
  CountingSink sink;
  pmhost::QueueReader reader("src", Base(), &sink);
  std::uint32_t token = 0;
  const std::uint8_t three[3] = {1, 2, 3};
  EXPECT_FALSE(reader.Handle(three, 3, &token));
  EXPECT_FALSE(reader.Handle(nullptr, 0, &token));
  // (Records that fit are handed on whole through the whole chain: the fault
  // suite's ramp checks.)
  EXPECT_EQ(sink.frames, 0);
}

// Once the host has asked the source to stop, the task removes its segments:
// a record still on its way that names one of them is no fault of the task.
TEST(RecordRefusals, ARecordNamingAGoneSegmentAfterStopSourceIsDroppedQuietly) {
  pmtest::LogCapture log;
  CountingSink sink;
  pmhost::QueueReader reader("src", Base(), &sink);
  reader.Stopping();
  const Wire gone = Video(5, 4096, 0, pm::kCode2vuy, 32, 16);
  std::uint32_t token = 0;
  EXPECT_TRUE(reader.Handle(gone.data(), gone.size(), &token));
  EXPECT_EQ(std::make_tuple(token, sink.frames, sink.bad, reader.BadRecords(), log.Count("record skipped: ")),
            std::make_tuple(5u, 0, 0, std::uint64_t{0}, 0));
}

TEST(SegmentCache, RemapsWhenTheSizeChangesKeepsOldHoldersValidAndRefusesShortSegments) {
  pmtest::LogCapture log;
  pmhost::SegmentCache cache(Base());
  auto first = std::make_unique<Segment>("/" + Base() + "1", 4096, 0x11);
  auto a = cache.Map(1, 4096);
  ASSERT_TRUE(a);
  EXPECT_EQ(cache.Map(1, 4096), a);  // cached
  first.reset();
  Segment second("/" + Base() + "1", 8192, 0x22);
  auto b = cache.Map(1, 8192);
  ASSERT_TRUE(b);
  EXPECT_NE(a, b);
  EXPECT_EQ(b->Size(), 8192u);
  EXPECT_EQ(b->Data()[8191], 0x22);
  EXPECT_EQ(a->Data()[4095], 0x11);  // the old holder still reads its own mapping
  cache.Forget(1);
  EXPECT_EQ(cache.Count(), 0u);
  EXPECT_EQ(b->Data()[0], 0x22);
  EXPECT_FALSE(cache.Map(1, 16384)) << "a segment smaller than the record says is not mapped";
  EXPECT_FALSE(cache.Map(3, 4096)) << "no such segment";
  EXPECT_EQ(log.Count("SegmentMapping::Open"), 2);
}

TEST(SegmentCleanup, RemovesOnlyTheBaseFollowedByDigits) {
  const std::string base = Base() + "x";
  const std::pair<std::string, bool> kept[] = {{base + "1", false}, {base + "27", false}, {base + "1abc", true},
                                               {Base() + "y1", true}};
  std::vector<std::unique_ptr<Segment>> made;
  for (const auto& [name, _] : kept) made.push_back(std::make_unique<Segment>("/" + name, 4096, 0));
  EXPECT_EQ(pmhost::RemoveSegments(base), 2);
  for (const auto& [name, stays] : kept) EXPECT_EQ(std::filesystem::exists("/dev/shm/" + name), stays) << name;
  EXPECT_EQ(pmhost::RemoveSegments(""), 0);
  EXPECT_EQ(pmhost::RemoveSegments("a/b"), 0);
}

}  // namespace

// The host's segments: a size change remaps, a segment shorter than its
// record is refused, and a crashed runner's segments are removed by prefix
// only. The queue side itself (records decoded as written, tokens back so
// segments are reused) runs in every whole-chain case of tests/faults and
// tests/pm-host; "::delete_memory" comes only with compressed pictures,
// which the host refuses.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>

#include "pm-host/segments.h"
#include "support/log_capture.h"

namespace {

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
  {
    Segment a("/" + base + "1", 4096, 0), b("/" + base + "27", 4096, 0);
    Segment other("/" + base + "1abc", 4096, 0), elsewhere("/" + Base() + "y1", 4096, 0);
    EXPECT_EQ(pmhost::RemoveSegments(base), 2);
    EXPECT_FALSE(std::filesystem::exists("/dev/shm/" + base + "1"));
    EXPECT_FALSE(std::filesystem::exists("/dev/shm/" + base + "27"));
    EXPECT_TRUE(std::filesystem::exists("/dev/shm/" + base + "1abc"));
    EXPECT_TRUE(std::filesystem::exists("/dev/shm/" + Base() + "y1"));
  }
  EXPECT_EQ(pmhost::RemoveSegments(""), 0);
  EXPECT_EQ(pmhost::RemoveSegments("a/b"), 0);
}

}  // namespace

// The segment pool of a source and its record channel to the host: ids,
// sizes, reuse, holds, records with their check bytes, the host connection,
// GPU segments, and what the system still holds of the segments.
#include <gtest/gtest.h>

#include <cstring>

#include "pm/runtime/context.h"
#include "pm/runtime/little_endian.h"
#include "pm/runtime/system.h"
#include "pm/shm/shared_gpu_memory.h"
#include "pm/shm/shared_memory_queue.h"
#include "support/host_link.h"
#include "support/log_capture.h"
#include "support/segment_probe.h"
#include "support/video_format.h"
#include "support/wait.h"

namespace {

using pm::SharedMemoryQueueProducer;
using pmtest::SegmentBytes;
using pmtest::VideoFormatOf;

std::pair<unsigned, unsigned> Sums(const std::uint8_t* bytes, std::size_t length) {
  const pm::FletcherSums sums = pm::Fletcher16(bytes, length);
  return {sums.sum1, sums.sum2};
}

struct StartedQueue {
  pmtest::HostLink link;
  std::shared_ptr<SharedMemoryQueueProducer> queue = std::make_shared<SharedMemoryQueueProducer>();
  std::string base = "pmtestq" + std::to_string(pm::CurrentProcessId()) + "_";
  std::atomic<bool> hostConnected{false};

  StartedQueue() {
    queue->StartQueue(link.Dispatcher(), "NDICaptureDevice~CAM", base, [this] { hostConnected = true; });
    EXPECT_TRUE(link.ReadCommand("NDICaptureDevice~CAM::start_queue"));
  }
};

// Ids count from one, skip those in use and wrap past zero; segments are
// named after the memory base and their id, sized in whole pages, and all gone
// from the system with the queue.
TEST(QueueIds, CountFromOneSkipInUseIdsAndWrapPastZeroAndNameSegmentsOfWholePages) {
  std::string one, more;
  {
    StartedQueue q;
    auto a = q.queue->AllocateCpuBuffer(1);
    auto b = q.queue->AllocateCpuBuffer(4097);
    EXPECT_EQ(std::make_pair(a->id, b->id), std::make_pair(1u, 2u));
    one = q.base + "1";
    more = q.base + "2";
    EXPECT_EQ(std::make_tuple(SegmentBytes(one), SegmentBytes(more)), std::make_tuple(4096u, 8192u));
    q.queue->DeleteBuffer(b);
    EXPECT_EQ(q.queue->AllocateCpuBuffer(1)->id, 3u);  // ids keep growing after a delete
    q.queue->SeedNextId(0xFFFFFFFFu);
    EXPECT_EQ(q.queue->AllocateCpuBuffer(1)->id, 0xFFFFFFFFu);
    // Wrapped: 0 is never used, 1 is still in the pool, 2 is free again.
    EXPECT_EQ(q.queue->AllocateCpuBuffer(1)->id, 2u);
    EXPECT_EQ(q.queue->AllocateCpuBuffer(0), nullptr);
  }
  EXPECT_EQ(std::make_tuple(SegmentBytes(one), SegmentBytes(more)), std::make_tuple(0u, 0u));
}

TEST(QueueReuse, PicksTheSmallestFreeSegmentThatFitsAndNeverAHeldOne) {
  StartedQueue q;
  auto big = q.queue->AllocateVideoBuffer(VideoFormatOf(pm::kCode2vuy, 64, 64), 0, false);  // 8192 bytes
  const pm::VideoFormat format = VideoFormatOf(pm::kCode2vuy, 64, 16);
  auto small = q.queue->AllocateVideoBuffer(format, 0, false);
  ASSERT_TRUE(big && small);
  EXPECT_EQ(big->descriptor.stride, 128u);
  EXPECT_EQ(q.queue->AllocateVideoBuffer(format, 0, true), nullptr);  // both held
  q.queue->ReturnBuffer(big);
  q.queue->ReturnBuffer(small);
  EXPECT_EQ(q.queue->AllocateVideoBuffer(format, 0, true), small);
  EXPECT_EQ(q.queue->AllocateVideoBuffer(format, 0, true), big);  // small is held now
  EXPECT_EQ(q.queue->AllocateVideoBuffer(format, 0, true), nullptr);
  // A larger stride than the segment was laid out for does not fit.
  q.queue->ReturnBuffer(big);
  EXPECT_EQ(q.queue->AllocateVideoBuffer(format, 256, true), nullptr);
  // FindFreeBuffer takes a hold too: two requests never share a segment.
  EXPECT_EQ(q.queue->FindFreeBuffer(8192), big);
  EXPECT_EQ(q.queue->FindFreeBuffer(4096), nullptr);
}

TEST(QueueRecords, CarryTokenDescriptorPayloadAndCheckBytesAndFreeTheSegmentOnReturn) {
  StartedQueue q;
  pmtest::QueueReader host(q.queue->Port());
  auto segment = q.queue->AllocateCpuBuffer(100);
  segment->descriptor.stride = 1;
  std::uint8_t payload[34];
  for (int i = 0; i < 34; ++i) payload[i] = static_cast<std::uint8_t>(0xA0 + i);
  // The host's connection is accepted on the listener thread.
  ASSERT_TRUE(pmtest::WaitFor([&] { return q.hostConnected.load(); }));
  EXPECT_TRUE(q.queue->SendBuffer(segment, payload));
  std::uint32_t token = 0;
  std::uint8_t record[60];
  ASSERT_TRUE(host.ReadRecord(&token, record));
  EXPECT_EQ(token, segment->id);
  EXPECT_EQ(std::memcmp(record, ".UPC", 4), 0);  // the CPU type tag
  EXPECT_EQ(pm::LoadLe64(record + 12), 4096u);  // the segment's size
  EXPECT_EQ(std::memcmp(record + 24, payload, 34), 0);
  // The host checks records with Fletcher-16 ('abc' is its reference vector).
  EXPECT_EQ(Sums(record, 60), std::make_pair(0u, 0u));
  const std::uint8_t abc[3] = {'a', 'b', 'c'};
  EXPECT_EQ(Sums(abc, 3), std::make_pair(39u, 76u));
  EXPECT_EQ(pm::FletcherCheckBytes(abc, 3), (std::array<std::uint8_t, 2>{0x8C, 0x4C}));

  EXPECT_EQ(segment->inUse.load(), 1);  // held until the host returns the token
  ASSERT_TRUE(host.ReturnToken(token));
  EXPECT_TRUE(pmtest::WaitFor([&] { return segment->inUse.load() == 0; }));
}

// Without a host the hold goes at once; a queue not started refuses records,
// and a deleted segment (announced to the host) is refused with a log line.
TEST(QueueRecords, WithoutAHostTheHoldGoesAtOnceAndUnstartedOrDeletedAreRefused) {
  std::uint8_t payload[34] = {};
  const auto unstarted = std::make_shared<SharedMemoryQueueProducer>();
  EXPECT_FALSE(unstarted->SendBuffer(unstarted->AllocateCpuBuffer(100), payload));
  StartedQueue q;
  auto segment = q.queue->AllocateCpuBuffer(100);
  EXPECT_TRUE(q.queue->SendBuffer(segment, payload));
  EXPECT_EQ(segment->inUse.load(), 0);
  q.queue->DeleteBuffer(segment);
  auto deleted = q.link.ReadCommand("NDICaptureDevice~CAM::delete_memory");
  ASSERT_TRUE(deleted.has_value());
  EXPECT_EQ((*deleted)["unique_id"], segment->id);
  pmtest::LogCapture capture;
  EXPECT_FALSE(q.queue->SendBuffer(segment, payload));
  EXPECT_EQ(capture.Count("Attempt to use deleted buffer"), 1);
}

// A GPU memory manager that a runner could register in the context: its
// segments hold no memory (size 1, nothing to lock).
struct FakeGpuSegment : pm::SharedGpuMemory {
  explicit FakeGpuSegment(const pm::VideoFormat& f) : format(f) { descriptor.size = 1; }
  std::uint64_t Size() const override { return descriptor.size; }
  std::pair<std::uint8_t*, std::int32_t> Lock() override { return {nullptr, 0}; }
  void Unlock() override {}
  bool IsLocked() const override { return false; }
  pm::VideoFormat Format() const override { return format; }
  pm::VideoFormat format;
};

struct FakeGpuManager : pm::SharedGpuMemoryManager {
  std::shared_ptr<pm::SharedMemory> Allocate(const pm::VideoFormat& format) override {
    ++made;
    return std::make_shared<FakeGpuSegment>(format);
  }
  int made = 0;
};

TEST(QueueGpu, ARegisteredManagerIsPreferredAndMatchedFieldByField) {
  auto manager = std::make_shared<FakeGpuManager>();
  ASSERT_EQ(pm::FindSingleton("SharedGpuMemoryManager", [&] { return manager; }), manager);
  {
    StartedQueue q;
    const pm::VideoFormat format = VideoFormatOf(pm::kCodeNV12, 1920, 1080);
    auto segment = q.queue->AllocateVideoBuffer(format, 0, false);
    ASSERT_TRUE(segment);
    EXPECT_EQ(segment->descriptor.type, pm::kGpuMemoryType);
    EXPECT_EQ(manager->made, 1);
    q.queue->ReturnBuffer(segment);
    // Extra width/height 0 count as width/height; byteSize is not compared.
    pm::VideoFormat same = format;
    same.extraWidth = 1920;
    same.byteSize = 77;
    EXPECT_EQ(q.queue->AllocateVideoBuffer(same, 0, true), segment);
    q.queue->ReturnBuffer(segment);
    pm::VideoFormat other = format;
    other.scan = 'P';
    EXPECT_EQ(q.queue->AllocateVideoBuffer(other, 0, true), nullptr);
  }
  std::lock_guard<std::mutex> guard(pm::GetContext()->registryLock);
  pm::GetContext()->registry.erase("SharedGpuMemoryManager");
}

}  // namespace

// The host's queue side against the task's real buffer queue in this
// process: frames arrive as written, tokens go back so segments are reused,
// "::delete_memory" unmaps, a size change remaps, and a crashed runner's
// segments are removed by prefix only. Sound through the same queue: the
// whole-chain channel-count cases of tests/faults.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <mutex>

#include "pm-host/segments.h"
#include "pm-host/session.h"
#include "pm/ipc/server.h"
#include "pm/shm/shared_memory_queue.h"
#include "pm/task/callbacks.h"
#include "support/log_capture.h"
#include "support/wait.h"

namespace {

using nlohmann::json;

const std::string kId = "NDICaptureDevice~HOST (Cam 1)";

// What the host hands its sink: each picture's frame and a copy of its bytes.
struct RecordingSink : pmhost::FrameSink {
  void OnVideo(const std::string&, const pmhost::VideoFrame& f) override {
    std::lock_guard<std::mutex> guard(lock);
    videos.push_back(f);
    pictures.emplace_back(f.data, f.data + f.bytes);
  }
  void OnAudio(const std::string&, const pmhost::AudioFrame&) override {}
  std::size_t Videos() {
    std::lock_guard<std::mutex> guard(lock);
    return videos.size();
  }
  std::mutex lock;  // guards videos, pictures
  std::vector<pmhost::VideoFrame> videos;
  std::vector<std::vector<std::uint8_t>> pictures;
};

// The task's source callbacks and their queue, linked to a host Session in
// this process; one picture at a time goes through, and every one must come
// back as written, its token returned so that one segment serves them all.
// Then "::delete_memory" unmaps that segment on the host's side.
TEST(HostQueue, PicturesArriveAsWrittenTokensComeBackAndDeleteMemoryUnmaps) {
  auto server = pm::ipc::Server::CreateListening();
  std::shared_ptr<pm::ipc::Connection> task = pm::ipc::Connection::Open(server->GetPort());
  std::shared_ptr<pm::ipc::Connection> host = server->AcceptConnection(5000);
  server->Stop();
  auto dispatcher = std::make_shared<pm::RpcDispatcher>(task);
  dispatcher->Start();
  RecordingSink sink;
  pmhost::Session session(host, [](const std::string&, const json&) {}, &sink);
  session.Start();
  session.AcceptQueue(kId);
  auto callbacks = std::make_shared<pm::SourceCallbacks>(dispatcher, kId);
  callbacks->OpenBufferQueue(dispatcher, kId);
  ASSERT_TRUE(pmtest::WaitFor([&] { return callbacks->Producer()->HostConnected(); }));
  for (int i = 0; i < 50; ++i) {
    const int width = 32, height = 4;
    pm::VideoFormat format;
    format.code = pm::kCode2vuy;
    format.width = width;
    format.height = height;
    format.scan = pm::kScanProgressive;
    auto buffer = callbacks->RequestVideoBuffer(format, 0);
    ASSERT_TRUE(buffer);
    auto [data, stride] = buffer->MapData();
    ASSERT_EQ(stride, 2 * width);
    for (int b = 0; b < 2 * width * height; ++b) data[b] = static_cast<std::uint8_t>(i + b);
    buffer->UnmapData();
    callbacks->SendVideoBuffer(705'600'000 + i, std::move(buffer));
    ASSERT_TRUE(pmtest::WaitFor([&] { return sink.Videos() == static_cast<std::size_t>(i + 1); }));
    {
      std::lock_guard<std::mutex> guard(sink.lock);
      const pmhost::VideoFrame& f = sink.videos.back();
      EXPECT_EQ(std::vector<std::int64_t>({f.code, f.width, f.height, f.stride, f.mediaTime}),
                std::vector<std::int64_t>({pm::kCode2vuy, width, height, 2 * width, 705'600'000 + i}));
      const std::vector<std::uint8_t>& p = sink.pictures.back();
      ASSERT_EQ(p.size(), static_cast<std::size_t>(2 * width * height));
      for (std::size_t b = 0; b < p.size(); ++b) ASSERT_EQ(p[b], static_cast<std::uint8_t>(i + b)) << b;
    }
    // The next request finds the segment free only when the host has given
    // the token back.
    ASSERT_TRUE(pmtest::WaitFor([&] {
      auto free = callbacks->Producer()->FindFreeBuffer(1);
      if (free) callbacks->Producer()->ReturnBuffer(free);
      return free != nullptr;
    }));
  }
  EXPECT_EQ(callbacks->Producer()->BufferCount(), 1u);
  auto queue = session.Queue(kId);
  ASSERT_TRUE(queue);
  EXPECT_EQ(queue->BadRecords(), 0u);
  EXPECT_EQ(queue->MappedSegments(), 1u);
  ASSERT_TRUE(pmtest::WaitFor([&] { return callbacks->Producer()->DeleteSmallestFreeBuffer(); }));
  EXPECT_TRUE(pmtest::WaitFor([&] { return queue->MappedSegments() == 0; }));
  callbacks.reset();
  session.Stop();
  dispatcher->Stop();
}

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

// The host's queue side against the task's real buffer queue in this
// process: frames arrive as written, tokens go back so segments are reused,
// "::delete_memory" unmaps, a size change remaps, and a crashed runner's
// segments are removed by prefix only.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
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

struct Recorded {
  std::mutex lock;  // guards everything below
  std::vector<std::vector<std::uint8_t>> pictures;
  std::vector<pmhost::VideoFrame> videos;
  std::vector<pmhost::AudioFrame> audios;
  std::vector<std::vector<float>> sounds;
  std::vector<std::string> notifications;
};

struct RecordingSink : pmhost::FrameSink {
  explicit RecordingSink(Recorded& r) : r(r) {}
  void OnVideo(const std::string&, const pmhost::VideoFrame& f) override {
    std::lock_guard<std::mutex> guard(r.lock);
    r.videos.push_back(f);
    r.pictures.emplace_back(f.data, f.data + f.bytes);
  }
  void OnAudio(const std::string&, const pmhost::AudioFrame& f) override {
    std::lock_guard<std::mutex> guard(r.lock);
    r.audios.push_back(f);
    const auto* s = reinterpret_cast<const float*>(f.data);
    r.sounds.emplace_back(s, s + f.bytes / 4);
  }
  Recorded& r;
};

// A task-side dispatcher and source callbacks, linked to a host Session.
struct Link {
  Link() {
    auto server = pm::ipc::Server::CreateListening();
    std::shared_ptr<pm::ipc::Connection> task = pm::ipc::Connection::Open(server->GetPort());
    std::shared_ptr<pm::ipc::Connection> host = server->AcceptConnection(5000);
    server->Stop();
    taskDispatcher = std::make_shared<pm::RpcDispatcher>(task);
    taskDispatcher->Start();
    session = std::make_unique<pmhost::Session>(
        host,
        [this](const std::string& command, const json&) {
          std::lock_guard<std::mutex> guard(recorded.lock);
          recorded.notifications.push_back(command);
        },
        &sink);
    session->Start();
    session->AcceptQueue(kId);
    callbacks = std::make_shared<pm::SourceCallbacks>(taskDispatcher, kId);
    callbacks->OpenBufferQueue(taskDispatcher, kId);
    EXPECT_TRUE(pmtest::WaitFor([&] { return callbacks->Producer()->HostConnected(); }));
  }
  ~Link() {
    callbacks.reset();
    session->Stop();
    taskDispatcher->Stop();
  }

  std::size_t Videos() {
    std::lock_guard<std::mutex> guard(recorded.lock);
    return recorded.videos.size();
  }

  // Sends one '2vuy' picture whose bytes are (seed + i).
  void SendPicture(int width, int height, std::uint8_t seed, std::int64_t time) {
    pm::VideoFormat format;
    format.code = pm::kCode2vuy;
    format.width = static_cast<std::int16_t>(width);
    format.height = static_cast<std::int16_t>(height);
    format.scan = pm::kScanProgressive;
    auto buffer = callbacks->RequestVideoBuffer(format, 0);
    ASSERT_TRUE(buffer);
    auto [data, stride] = buffer->MapData();
    for (int y = 0; y < height; ++y) {
      for (int x = 0; x < width * 2; ++x) data[y * stride + x] = static_cast<std::uint8_t>(seed + y * 3 + x);
    }
    buffer->UnmapData();
    callbacks->SendVideoBuffer(time, std::move(buffer));
  }

  Recorded recorded;
  RecordingSink sink{recorded};
  std::shared_ptr<pm::RpcDispatcher> taskDispatcher;
  std::unique_ptr<pmhost::Session> session;
  std::shared_ptr<pm::SourceCallbacks> callbacks;
};

TEST(HostQueue, PicturesAndSoundArriveAsWrittenWithTheirTimeAndShape) {
  Link link;
  link.SendPicture(64, 8, 5, 705'600'000);
  auto buffer = link.callbacks->RequestAudioBuffer(pm::AudioFormat{pm::kCodeFl32, 48000, 2}, 480);
  ASSERT_TRUE(buffer);
  buffer->Fill([](void* data, std::int64_t bytes) {
    for (std::int64_t i = 0; i < bytes / 4; ++i) static_cast<float*>(data)[i] = static_cast<float>(i) / 1024.0f;
  });
  link.callbacks->SendAudioBuffer(42, std::move(buffer));
  ASSERT_TRUE(pmtest::WaitFor([&] {
    std::lock_guard<std::mutex> guard(link.recorded.lock);
    return link.recorded.videos.size() == 1 && link.recorded.audios.size() == 1;
  }));
  std::lock_guard<std::mutex> guard(link.recorded.lock);
  const pmhost::VideoFrame& f = link.recorded.videos[0];
  EXPECT_EQ(std::vector<int>({static_cast<int>(f.code), f.width, f.height, static_cast<int>(f.stride)}),
            std::vector<int>({static_cast<int>(pm::kCode2vuy), 64, 8, 128}));
  EXPECT_EQ(f.mediaTime, 705'600'000);
  const std::vector<std::uint8_t>& p = link.recorded.pictures[0];
  ASSERT_EQ(p.size(), 128u * 8);
  for (std::size_t i = 0; i < p.size(); ++i) ASSERT_EQ(p[i], static_cast<std::uint8_t>(5 + i / 128 * 3 + i % 128)) << i;
  const pmhost::AudioFrame& a = link.recorded.audios[0];
  EXPECT_EQ(std::vector<int>({a.samples, a.channels, a.rate}), std::vector<int>({480, 2, 48000}));
  ASSERT_EQ(link.recorded.sounds[0].size(), 960u);
  for (std::size_t i = 0; i < 960; ++i) ASSERT_EQ(link.recorded.sounds[0][i], static_cast<float>(i) / 1024.0f);
}

TEST(HostQueue, ReturnedTokensLetTheTaskReuseOneSegment) {
  Link link;
  for (int i = 0; i < 50; ++i) {
    link.SendPicture(32, 4, static_cast<std::uint8_t>(i), i);
    // One at a time: the next request finds the segment free only when the
    // host has given the token back.
    ASSERT_TRUE(pmtest::WaitFor([&] { return link.Videos() == static_cast<std::size_t>(i + 1); }));
    ASSERT_TRUE(pmtest::WaitFor([&] {
      // The segment's hold goes when the host's token is back.
      auto free = link.callbacks->Producer()->FindFreeBuffer(1);
      if (free) link.callbacks->Producer()->ReturnBuffer(free);
      return free != nullptr;
    }));
  }
  EXPECT_EQ(link.callbacks->Producer()->BufferCount(), 1u);
  EXPECT_EQ(link.callbacks->VideoBufferCount(), 1);
  auto queue = link.session->Queue(kId);
  ASSERT_TRUE(queue);
  EXPECT_EQ(queue->BadRecords(), 0u);
}

TEST(HostQueue, DeleteMemoryUnmapsTheSegment) {
  Link link;
  link.SendPicture(32, 4, 1, 0);
  ASSERT_TRUE(pmtest::WaitFor([&] { return link.Videos() == 1; }));
  auto queue = link.session->Queue(kId);
  ASSERT_TRUE(queue);
  ASSERT_TRUE(pmtest::WaitFor([&] { return queue->MappedSegments() == 1; }));
  // Free once the token is back.
  ASSERT_TRUE(pmtest::WaitFor([&] { return link.callbacks->Producer()->DeleteSmallestFreeBuffer(); }));
  EXPECT_TRUE(pmtest::WaitFor([&] { return queue->MappedSegments() == 0; }));
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

TEST(SegmentMapping, UnmapsOnDestructionAndMovesOwnership) {
  Segment s("/" + Base() + "m", 4096, 0x5A);
  pmhost::SegmentMapping m = pmhost::SegmentMapping::Open("/" + Base() + "m", 4096);
  ASSERT_TRUE(m);
  const void* address = m.Data();
  pmhost::SegmentMapping moved = std::move(m);
  EXPECT_FALSE(m);  // NOLINT: moved-from is empty by contract
  EXPECT_EQ(moved.Data(), address);
  moved = pmhost::SegmentMapping();
  // The page is gone from this process: mincore reports ENOMEM for it.
  unsigned char vec = 0;
  EXPECT_NE(::mincore(const_cast<void*>(address), 4096, &vec), 0);
}

}  // namespace

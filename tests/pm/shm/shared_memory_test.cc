// POSIX segments checked against what the system shows: /dev/shm entries,
// open descriptors of this process, and a second process that maps the
// segment by name the way the host does.

#include "pm/shm/shared_cpu_memory_posix.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <functional>
#include <string>

#include "support/log_capture.h"
#include "support/segment_probe.h"
#include "support/wait.h"

namespace {

using pmtest::SegmentBytes;
using pmtest::SegmentExists;
using Segment = pm::SharedCpuMemoryPosix;

std::string Prefix() { return "pmtest-shm-" + std::to_string(::getpid()) + "-"; }

std::string UniqueName() {
  static int counter = 0;
  return Prefix() + std::to_string(++counter);
}

int OpenDescriptors() {  // less the listing's own
  return static_cast<int>(std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {})) - 1;
}

// A private entry of the whole size, whose mapping keeps no descriptor open;
// without a name Create makes a unique one; creating again releases the old
// name first; destruction removes the name.
TEST(SharedCpuMemory, CreateMakesAPrivateUniqueEntryAndReCreateOrDestructionRemovesIt) {
  const int descriptorsBefore = OpenDescriptors();
  auto a = Segment::New();
  auto b = Segment::New();
  ASSERT_TRUE(a->Create(std::nullopt, 4096));
  ASSERT_TRUE(b->Create(std::nullopt, 4096));
  const std::string first = a->GetName(), other = b->GetName(), name = UniqueName();
  EXPECT_NE(first, other);
  EXPECT_TRUE(SegmentExists(first));
  ASSERT_TRUE(a->Create(name, 8192));
  EXPECT_FALSE(SegmentExists(first));
  EXPECT_EQ(std::make_pair(a->GetName(), a->Size()), std::make_pair(name, std::uint64_t{8192}));
  struct stat info {};
  ASSERT_EQ(::stat(("/dev/shm/" + name).c_str(), &info), 0);
  EXPECT_EQ(std::make_pair(info.st_mode & 0777, info.st_size), std::make_pair(0600u, off_t{8192}));
  EXPECT_EQ(OpenDescriptors(), descriptorsBefore);
  a->Data()[8191] = 1;  // the whole size is backed
  a.reset();
  b.reset();
  EXPECT_FALSE(SegmentExists(name));
  EXPECT_FALSE(SegmentExists(other));
}

// A second process (using only system calls, like a host) maps the segment
// by name, reads what the task wrote and writes back; its mapping outlives
// the creator and the name, which the creator removes.
TEST(SharedCpuMemory, AnotherProcessSharesTheSegmentByNameAndOutlivesItsCreator) {
  constexpr int kSize = 4096 * 3;
  const std::string name = UniqueName();
  auto segment = Segment::New();
  ASSERT_TRUE(segment->Create(name, kSize));
  for (int i = 0; i < kSize; ++i) segment->Data()[i] = static_cast<std::uint8_t>(i * 13);

  const std::string path = "/" + name, file = "/dev/shm/" + name;
  const pid_t pid = ::fork();
  if (pid == 0) {  // maps "/" + name as the host does
    const int fd = ::shm_open(path.c_str(), O_RDWR, 0);
    void* mapped = fd < 0 ? MAP_FAILED : ::mmap(nullptr, kSize, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    if (mapped == MAP_FAILED) ::_exit(10);
    auto* view = static_cast<std::uint8_t*>(mapped);
    for (int i = 0; i < kSize; ++i)
      if (view[i] != static_cast<std::uint8_t>(i * 13)) ::_exit(11);
    std::memcpy(view + 100, "from the host", 13);
    // Until the creator has gone (60 s at most): then the name is gone, the
    // mapping is not.
    for (int i = 0; i < 6000 && ::access(file.c_str(), F_OK) == 0; ++i) ::usleep(10000);
    if (::shm_open(path.c_str(), O_RDWR, 0) >= 0 || errno != ENOENT) ::_exit(22);
    ::_exit(view[kSize - 1] == static_cast<std::uint8_t>((kSize - 1) * 13) ? 0 : 23);
  }
  ASSERT_GT(pid, 0);
  EXPECT_TRUE(pmtest::WaitFor([&] { return std::memcmp(segment->Data() + 100, "from the host", 13) == 0; }));
  segment.reset();
  EXPECT_FALSE(SegmentExists(name));
  int status = 0;
  ASSERT_EQ(::waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
}

// Open, or Create on a name that exists, maps the same object: never shrunk
// under a reader of the larger size, grown for a larger request, and unlinked
// only by its creator.
TEST(SharedCpuMemory, ExistingNamesAreSharedNeverShrunkAndUnlinkedOnlyByTheCreator) {
  const std::string name = UniqueName();
  auto creator = Segment::New();
  ASSERT_TRUE(creator->Create(name, 16384));
  {
    auto opener = Segment::New();
    ASSERT_TRUE(opener->Open(name, 4096));
    opener->Data()[7] = 42;
    EXPECT_EQ(creator->Data()[7], 42);
    auto second = Segment::New();
    ASSERT_TRUE(second->Create(name, 4096));
    EXPECT_EQ(std::make_tuple(second->OwnsName(), second->Data()[7], second->Size()),
              std::make_tuple(false, 42, std::uint64_t{4096}));
    EXPECT_EQ(SegmentBytes(name), 16384u);
    creator->Data()[16383] = 9;
    auto larger = Segment::New();
    ASSERT_TRUE(larger->Create(name, 32768));
    EXPECT_EQ(SegmentBytes(name), 32768u);
    larger->Data()[32767] = 3;
    EXPECT_EQ(larger->Data()[16383], 9);
  }
  EXPECT_TRUE(SegmentExists(name));
  creator.reset();
  EXPECT_FALSE(SegmentExists(name));
}

// Locks nest; a stray Unlock does not wrap the count into "locked for good";
// the stride set before the first lock is what Lock reports. MakeShared hands
// the segment to its release instead of deleting it.
TEST(SharedCpuMemory, LocksNestAStrayUnlockDoesNotWrapAndMakeSharedReleasesInsteadOfDeleting) {
  auto segment = Segment::New();
  EXPECT_EQ(segment->Lock(), std::make_pair(static_cast<std::uint8_t*>(nullptr), 0));  // unmapped, still counted
  segment->Unlock();
  segment->Unlock();
  EXPECT_FALSE(segment->IsLocked());
  ASSERT_TRUE(segment->Create(UniqueName(), 4096));
  segment->descriptor.stride = 3840;
  EXPECT_EQ(segment->Lock(), std::make_pair(segment->Data(), 3840));
  segment->Lock();
  segment->Unlock();
  EXPECT_TRUE(segment->IsLocked());
  segment->Unlock();
  EXPECT_FALSE(segment->IsLocked());

  pm::SharedMemory* released = nullptr;
  std::shared_ptr<pm::SharedMemory> owner = segment->MakeShared([&](pm::SharedMemory* s) { released = s; });
  std::shared_ptr<pm::SharedMemory> copy = owner;
  owner.reset();
  EXPECT_EQ(released, nullptr);
  copy.reset();
  EXPECT_EQ(released, segment.get());
  EXPECT_NE(segment->Data(), nullptr);  // still alive and mapped
  segment->MakeShared(nullptr).reset();  // an empty release is harmless
}

// Every failure logs one line and leaves no mapping, no open descriptor and no
// entry in /dev/shm: mapping more than the object holds (it would fault past
// its end), a zero-byte segment (its fresh name goes again), a name with a
// slash, one too long, one missing.
TEST(SharedCpuMemory, FailuresLogOneLineAndLeaveNothingBehind) {
  const std::string existing = UniqueName(), empty = UniqueName(), missing = UniqueName();
  auto creator = Segment::New();
  ASSERT_TRUE(creator->Create(existing, 4096));
  const std::function<bool(Segment&)> cases[] = {
      [&](Segment& s) { return s.Open(existing, 8192); },
      [&](Segment& s) { return s.Create(empty, 0); },
      [&](Segment& s) { return s.Create(Prefix() + "a/b", 4096); },
      [&](Segment& s) { return s.Create(Prefix() + std::string(300, 'x'), 4096); },
      [&](Segment& s) { return s.Open(missing, 4096); },
  };
  const int descriptorsBefore = OpenDescriptors();
  for (const auto& call : cases) {
    SCOPED_TRACE(&call - cases);
    pmtest::LogCapture log;
    auto segment = Segment::New();
    EXPECT_FALSE(call(*segment));
    EXPECT_EQ(std::make_tuple(segment->Size(), segment->Data(), log.Lines().size(), OpenDescriptors()),
              std::make_tuple(std::uint64_t{0}, nullptr, std::size_t{1}, descriptorsBefore));
  }
  EXPECT_EQ(SegmentBytes(existing), 4096u);
  EXPECT_FALSE(SegmentExists(empty));
}

}  // namespace

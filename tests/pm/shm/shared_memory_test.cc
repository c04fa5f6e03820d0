// POSIX segments checked against what the system shows: /dev/shm entries,
// open descriptors of this process, and a second process that maps the
// segment by name the way the host does.

#include "pm/shm/shared_cpu_memory_posix.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "support/log_capture.h"
#include "support/segment_probe.h"

namespace {

using pmtest::SegmentBytes;
using pmtest::SegmentExists;
using Segment = pm::SharedCpuMemoryPosix;

std::string Prefix() { return "pmtest-shm-" + std::to_string(::getpid()) + "-"; }

std::string UniqueName() {
  static int counter = 0;
  return Prefix() + std::to_string(++counter);
}

int OpenDescriptors() {
  int count = 0;
  DIR* dir = ::opendir("/proc/self/fd");
  while (dirent* entry = ::readdir(dir)) count += entry->d_name[0] != '.';
  ::closedir(dir);
  return count - 1;  // the directory's own descriptor
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
  EXPECT_EQ(a->GetName(), name);
  EXPECT_EQ(a->Size(), 8192u);
  struct stat info {};
  ASSERT_EQ(::stat(("/dev/shm/" + name).c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777, 0600u);
  EXPECT_EQ(info.st_size, 8192);
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

  int toChild[2], toParent[2];
  ASSERT_EQ(::pipe(toChild), 0);
  ASSERT_EQ(::pipe(toParent), 0);
  const pid_t pid = ::fork();
  if (pid == 0) {  // maps "/" + name as the host does
    const int fd = ::shm_open(("/" + name).c_str(), O_RDWR, 0);
    void* mapped = fd < 0 ? MAP_FAILED : ::mmap(nullptr, kSize, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
    if (mapped == MAP_FAILED) ::_exit(10);
    auto* view = static_cast<std::uint8_t*>(mapped);
    for (int i = 0; i < kSize; ++i)
      if (view[i] != static_cast<std::uint8_t>(i * 13)) ::_exit(11);
    std::memcpy(view + 100, "from the host", 13);
    char c = 'm';
    if (::write(toParent[1], &c, 1) != 1 || ::read(toChild[0], &c, 1) != 1) ::_exit(20);
    // The name is gone; the mapping is not.
    if (::shm_open(("/" + name).c_str(), O_RDWR, 0) >= 0 || errno != ENOENT) ::_exit(22);
    if (view[kSize - 1] != static_cast<std::uint8_t>((kSize - 1) * 13)) ::_exit(23);
    view[kSize - 1] = 0x5A;
    ::_exit(0);
  }
  ASSERT_GT(pid, 0);
  char c = 0;
  EXPECT_EQ(::read(toParent[0], &c, 1), 1);
  EXPECT_EQ(0, std::memcmp(segment->Data() + 100, "from the host", 13));
  segment.reset();
  EXPECT_FALSE(SegmentExists(name));
  EXPECT_EQ(::write(toChild[1], "g", 1), 1);
  int status = 0;
  ASSERT_EQ(::waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  for (int fd : {toChild[0], toChild[1], toParent[0], toParent[1]}) ::close(fd);
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
    EXPECT_FALSE(second->OwnsName());
    EXPECT_EQ(second->Data()[7], 42);
    EXPECT_EQ(second->Size(), 4096u);
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
    EXPECT_EQ(segment->Size(), 0u);
    EXPECT_EQ(segment->Data(), nullptr);
    EXPECT_EQ(log.Lines().size(), 1u);
    EXPECT_EQ(OpenDescriptors(), descriptorsBefore);
  }
  EXPECT_EQ(SegmentBytes(existing), 4096u);
  EXPECT_FALSE(SegmentExists(empty));
}

}  // namespace

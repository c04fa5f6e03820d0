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

#include <cstddef>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "support/log_capture.h"

namespace {

std::string Prefix() { return "pmtest-shm-" + std::to_string(::getpid()) + "-"; }

std::string UniqueName() {
  static int counter = 0;
  return Prefix() + std::to_string(++counter);
}

// The size of /dev/shm/name, -1 when there is no such entry.
off_t DevShmSize(const std::string& name) {
  struct stat info {};
  return ::stat(("/dev/shm/" + name).c_str(), &info) == 0 ? info.st_size : -1;
}
bool DevShmHas(const std::string& name) { return DevShmSize(name) >= 0; }

int OpenDescriptors() {
  int count = 0;
  DIR* dir = ::opendir("/proc/self/fd");
  while (dirent* entry = ::readdir(dir)) count += entry->d_name[0] != '.';
  ::closedir(dir);
  return count - 1;  // the directory's own descriptor
}

std::vector<std::string> OurDevShmEntries() {
  std::vector<std::string> names;
  DIR* dir = ::opendir("/dev/shm");
  if (dir == nullptr) return names;
  while (dirent* entry = ::readdir(dir)) {
    const std::string name = entry->d_name;
    // Only names of this process: other test processes run beside this one
    // and make private (unnamed) segments of their own.
    if (name.rfind(Prefix(), 0) == 0) names.push_back(name);
  }
  ::closedir(dir);
  return names;
}

// Maps "/" + name as the host does; null on failure.
std::uint8_t* HostMap(const std::string& name, std::size_t size) {
  const int fd = ::shm_open(("/" + name).c_str(), O_RDWR, 0);
  if (fd < 0) return nullptr;
  void* view = ::mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  ::close(fd);
  return view == MAP_FAILED ? nullptr : static_cast<std::uint8_t*>(view);
}

class SharedCpuMemoryTest : public testing::Test {
 protected:
  void TearDown() override {
    const std::vector<std::string> left = OurDevShmEntries();
    EXPECT_TRUE(left.empty()) << "left in /dev/shm: " << (left.empty() ? "" : left.front());
    for (const std::string& name : left) ::shm_unlink(("/" + name).c_str());
  }
};

TEST_F(SharedCpuMemoryTest, CreateMakesAPrivateEntryAndDestructionRemovesIt) {
  const std::string name = UniqueName();
  const int descriptorsBefore = OpenDescriptors();
  {
    auto segment = pm::SharedCpuMemoryPosix::New();
    ASSERT_TRUE(segment->Create(name, 8192));
    EXPECT_EQ(segment->GetName(), name);
    EXPECT_EQ(segment->Size(), 8192u);
    ASSERT_NE(segment->Data(), nullptr);
    struct stat info {};
    ASSERT_EQ(::stat(("/dev/shm/" + name).c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0600u);
    EXPECT_EQ(info.st_size, 8192);
    EXPECT_EQ(std::uint64_t{segment->descriptor.size}, 8192u);  // (a copy of the packed field)
    // The mapping does not keep a descriptor open.
    EXPECT_EQ(OpenDescriptors(), descriptorsBefore);
    segment->Data()[8191] = 1;  // the whole size is backed
  }
  EXPECT_FALSE(DevShmHas(name));
}

// A second process (using only system calls, like a host) maps the segment
// by name, reads what the task wrote and writes back; its mapping outlives
// the creator and the name, which the creator removes.
TEST_F(SharedCpuMemoryTest, AnotherProcessSharesTheSegmentByNameAndOutlivesItsCreator) {
  constexpr int kSize = 4096 * 3;
  const std::string name = UniqueName();
  auto segment = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(segment->Create(name, kSize));
  for (int i = 0; i < kSize; ++i) segment->Data()[i] = static_cast<std::uint8_t>(i * 13);

  int toChild[2], toParent[2];
  ASSERT_EQ(::pipe(toChild), 0);
  ASSERT_EQ(::pipe(toParent), 0);
  const pid_t pid = ::fork();
  if (pid == 0) {
    std::uint8_t* view = HostMap(name, kSize);
    if (view == nullptr) ::_exit(10);
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
  EXPECT_FALSE(DevShmHas(name));
  EXPECT_EQ(::write(toChild[1], "g", 1), 1);
  int status = 0;
  ASSERT_EQ(::waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  for (int fd : {toChild[0], toChild[1], toParent[0], toParent[1]}) ::close(fd);
}

// Open, or Create on a name that exists, maps the same object: never shrunk
// under a reader of the larger size, grown for a larger request, and unlinked
// only by its creator.
TEST_F(SharedCpuMemoryTest, ExistingNamesAreSharedNeverShrunkAndUnlinkedOnlyByTheCreator) {
  const std::string name = UniqueName();
  auto creator = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(creator->Create(name, 16384));
  {
    auto opener = pm::SharedCpuMemoryPosix::New();
    ASSERT_TRUE(opener->Open(name, 4096));
    opener->Data()[7] = 42;
    EXPECT_EQ(creator->Data()[7], 42);
    auto second = pm::SharedCpuMemoryPosix::New();
    ASSERT_TRUE(second->Create(name, 4096));
    EXPECT_FALSE(second->OwnsName());
    EXPECT_EQ(second->Data()[7], 42);
    EXPECT_EQ(second->Size(), 4096u);
    EXPECT_EQ(DevShmSize(name), 16384);
    creator->Data()[16383] = 9;
    auto larger = pm::SharedCpuMemoryPosix::New();
    ASSERT_TRUE(larger->Create(name, 32768));
    EXPECT_EQ(DevShmSize(name), 32768);
    larger->Data()[32767] = 3;
    EXPECT_EQ(larger->Data()[16383], 9);
  }
  EXPECT_TRUE(DevShmHas(name));
  creator.reset();
  EXPECT_FALSE(DevShmHas(name));
}

// Without a name Create makes a unique one; creating again releases the old
// name first; destruction removes the name.
TEST_F(SharedCpuMemoryTest, NamesAreMadeUniqueAndTheOldOneGoesOnReCreate) {
  auto a = pm::SharedCpuMemoryPosix::New();
  auto b = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(a->Create(std::nullopt, 4096));
  ASSERT_TRUE(b->Create(std::nullopt, 4096));
  const std::string first = a->GetName(), other = b->GetName(), second = UniqueName();
  EXPECT_NE(first, other);
  EXPECT_EQ(first.size(), 36u + std::strlen(".net.quillfront.pm"));
  EXPECT_TRUE(first.ends_with(".net.quillfront.pm"));
  EXPECT_TRUE(DevShmHas(first));
  ASSERT_TRUE(a->Create(second, 8192));
  EXPECT_FALSE(DevShmHas(first));
  EXPECT_TRUE(DevShmHas(second));
  EXPECT_EQ(a->Size(), 8192u);
  b.reset();
  EXPECT_FALSE(DevShmHas(other));
}

TEST_F(SharedCpuMemoryTest, LockReportsTheStrideBeforeAndMarksLinelessSegments) {
  auto segment = pm::SharedCpuMemoryPosix::New();
  // Unmapped: no pointer, the stride stays 0, the lock still counts.
  auto [data, stride] = segment->Lock();
  EXPECT_EQ(data, nullptr);
  EXPECT_EQ(stride, 0);
  EXPECT_EQ(segment->descriptor.stride, 0u);
  EXPECT_TRUE(segment->IsLocked());
  segment->Unlock();
  EXPECT_FALSE(segment->IsLocked());

  ASSERT_TRUE(segment->Create(UniqueName(), 4096));
  EXPECT_EQ(segment->Lock().second, 0);
  EXPECT_EQ(segment->descriptor.stride, 1u);
  EXPECT_EQ(segment->Lock(), std::make_pair(segment->Data(), 1));
  segment->Unlock();
  EXPECT_TRUE(segment->IsLocked());
  segment->Unlock();
  EXPECT_FALSE(segment->IsLocked());

  segment->descriptor.stride = 3840;
  EXPECT_EQ(segment->Lock().second, 3840);
  segment->Unlock();
  EXPECT_EQ(segment->descriptor.stride, 3840u);

  // A stray Unlock does not wrap the count into "locked for good".
  segment->Unlock();
  EXPECT_FALSE(segment->IsLocked());
}

// Every failure logs one line and leaves no mapping, no open descriptor and no
// entry in /dev/shm. Mapping more than the object holds would fault past its
// end; a zero-byte segment cannot be mapped, and its fresh name goes again;
// for a long name the C library reports EINVAL or ENAMETOOLONG, depending on
// its version.
TEST_F(SharedCpuMemoryTest, FailuresLogOneLineAndLeaveNothingBehind) {
  const std::string existing = UniqueName(), empty = UniqueName(), missing = UniqueName();
  const std::string slash = Prefix() + "a/b", tooLong = Prefix() + std::string(300, 'x');
  auto creator = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(creator->Create(existing, 4096));
  const std::string mapFailed = "SharedCpuMemoryWin::MapFile cannot map view of file (22).\n";
  const std::string cannot = "SharedCpuMemoryWin::Create : Could not ";
  struct Case {
    const char* what;
    std::function<bool(pm::SharedCpuMemoryPosix&)> call;
    std::string line;  // the start of the one line logged
  };
  const Case cases[] = {
      {"larger than the object", [&](auto& s) { return s.Open(existing, 8192); }, mapFailed},
      {"zero bytes", [&](auto& s) { return s.Create(empty, 0); }, mapFailed},
      {"slash", [&](auto& s) { return s.Create(slash, 4096); }, cannot + "create '" + slash + "' (22).\n"},
      {"too long", [&](auto& s) { return s.Create(tooLong, 4096); }, cannot + "create '" + tooLong + "' ("},
      {"missing", [&](auto& s) { return s.Open(missing, 4096); }, cannot + "open '" + missing + "' (2).\n"},
  };
  const int descriptorsBefore = OpenDescriptors();
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    pmtest::LogCapture log;
    auto segment = pm::SharedCpuMemoryPosix::New();
    EXPECT_FALSE(c.call(*segment));
    EXPECT_EQ(segment->Size(), 0u);
    EXPECT_EQ(segment->Data(), nullptr);
    ASSERT_EQ(log.Lines().size(), 1u);
    EXPECT_EQ(log.Lines()[0].rfind(c.line, 0), 0u) << log.Lines()[0];
    EXPECT_EQ(OpenDescriptors(), descriptorsBefore);
  }
  EXPECT_EQ(DevShmSize(existing), 4096);
  EXPECT_FALSE(DevShmHas(empty));
}

TEST_F(SharedCpuMemoryTest, MakeSharedHandsTheSegmentToTheReleaseInsteadOfDeleting) {
  auto segment = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(segment->Create(UniqueName(), 4096));
  pm::SharedMemory* released = nullptr;
  {
    std::shared_ptr<pm::SharedMemory> owner = segment->MakeShared([&](pm::SharedMemory* s) { released = s; });
    std::shared_ptr<pm::SharedMemory> copy = owner;
    owner.reset();
    EXPECT_EQ(released, nullptr);
  }
  EXPECT_EQ(released, segment.get());
  EXPECT_NE(segment->Data(), nullptr);  // still alive and mapped
  { auto owner = segment->MakeShared(nullptr); }  // an empty release is harmless
}

}  // namespace

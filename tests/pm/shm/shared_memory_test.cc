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

bool DevShmHas(const std::string& name) {
  struct stat info {};
  return ::stat(("/dev/shm/" + name).c_str(), &info) == 0;
}

off_t DevShmSize(const std::string& name) {
  struct stat info {};
  return ::stat(("/dev/shm/" + name).c_str(), &info) == 0 ? info.st_size : -1;
}

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

// Runs `child` in a forked process and returns its exit status (-1 when it
// did not exit normally). The child uses only system calls, like a host.
int InChild(const std::function<int()>& child) {
  const pid_t pid = ::fork();
  if (pid == 0) ::_exit(child());
  int status = 0;
  if (pid < 0 || ::waitpid(pid, &status, 0) != pid) return -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
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

TEST_F(SharedCpuMemoryTest, NewSegmentDescriptorIsCpuTagThenZeros) {
  pm::SharedCpuMemoryPosix segment;
  std::uint8_t bytes[24];
  std::memcpy(bytes, &segment.descriptor, sizeof bytes);
  const std::uint8_t expected[24] = {0x2E, 0x55, 0x50, 0x43};
  EXPECT_EQ(0, std::memcmp(bytes, expected, sizeof bytes));
  EXPECT_EQ(segment.inUse.load(), 0);
  EXPECT_EQ(segment.id, 0u);
  EXPECT_EQ(segment.Data(), nullptr);
  EXPECT_EQ(offsetof(pm::BufferDescriptor, reserved), 4u);
  EXPECT_EQ(offsetof(pm::BufferDescriptor, size), 12u);
  EXPECT_EQ(offsetof(pm::BufferDescriptor, stride), 20u);
}

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
    // The size lands in the descriptor bytes that travel in every record.
    std::uint8_t bytes[24];
    std::memcpy(bytes, &segment->descriptor, sizeof bytes);
    EXPECT_EQ(bytes[12], 0x00);
    EXPECT_EQ(bytes[13], 0x20);
    // The mapping does not keep a descriptor open.
    EXPECT_EQ(OpenDescriptors(), descriptorsBefore);
    segment->Data()[8191] = 1;  // the whole size is backed
  }
  EXPECT_FALSE(DevShmHas(name));
}

TEST_F(SharedCpuMemoryTest, AnotherProcessReadsAndWritesTheSegmentByName) {
  const std::string name = UniqueName();
  auto segment = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(segment->Create(name, 4096 * 3));
  for (int i = 0; i < 4096 * 3; ++i) segment->Data()[i] = static_cast<std::uint8_t>(i * 13);

  const int status = InChild([&] {
    std::uint8_t* view = HostMap(name, 4096 * 3);
    if (view == nullptr) return 10;
    for (int i = 0; i < 4096 * 3; ++i)
      if (view[i] != static_cast<std::uint8_t>(i * 13)) return 11;
    std::memcpy(view + 100, "from the host", 13);
    return 0;
  });
  EXPECT_EQ(status, 0);
  EXPECT_EQ(0, std::memcmp(segment->Data() + 100, "from the host", 13));
}

TEST_F(SharedCpuMemoryTest, HostMappingOutlivesTheCreatorAndItsName) {
  const std::string name = UniqueName();
  auto segment = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(segment->Create(name, 4096));
  std::memcpy(segment->Data(), "frame bytes", 11);

  int toChild[2], toParent[2];
  ASSERT_EQ(::pipe(toChild), 0);
  ASSERT_EQ(::pipe(toParent), 0);
  const pid_t pid = ::fork();
  if (pid == 0) {
    std::uint8_t* view = HostMap(name, 4096);
    char c = view != nullptr ? 'm' : 'x';
    if (::write(toParent[1], &c, 1) != 1 || ::read(toChild[0], &c, 1) != 1) ::_exit(20);
    if (view == nullptr) ::_exit(21);
    // The name is gone; the mapping is not.
    if (::shm_open(("/" + name).c_str(), O_RDWR, 0) >= 0 || errno != ENOENT) ::_exit(22);
    if (std::memcmp(view, "frame bytes", 11) != 0) ::_exit(23);
    view[4095] = 0x5A;
    ::_exit(view[4095] == 0x5A ? 0 : 24);
  }
  ASSERT_GT(pid, 0);
  char c = 0;
  ASSERT_EQ(::read(toParent[0], &c, 1), 1);
  EXPECT_EQ(c, 'm');
  segment.reset();
  EXPECT_FALSE(DevShmHas(name));
  ASSERT_EQ(::write(toChild[1], "g", 1), 1);
  int status = 0;
  ASSERT_EQ(::waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  for (int fd : {toChild[0], toChild[1], toParent[0], toParent[1]}) ::close(fd);
}

TEST_F(SharedCpuMemoryTest, OnlyTheCreatorUnlinksTheName) {
  const std::string name = UniqueName();
  auto creator = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(creator->Create(name, 4096));
  {
    auto opener = pm::SharedCpuMemoryPosix::New();
    ASSERT_TRUE(opener->Open(name, 4096));
    opener->Data()[7] = 42;
    EXPECT_EQ(creator->Data()[7], 42);
    auto second = pm::SharedCpuMemoryPosix::New();
    ASSERT_TRUE(second->Create(name, 4096));  // an existing name is opened
    EXPECT_FALSE(second->OwnsName());
    EXPECT_EQ(second->Data()[7], 42);
  }
  EXPECT_TRUE(DevShmHas(name));
  creator.reset();
  EXPECT_FALSE(DevShmHas(name));
}

TEST_F(SharedCpuMemoryTest, CreateOnAnExistingNameNeverShrinksIt) {
  const std::string name = UniqueName();
  auto big = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(big->Create(name, 16384));
  auto small = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(small->Create(name, 4096));
  EXPECT_EQ(small->Size(), 4096u);
  EXPECT_EQ(DevShmSize(name), 16384);
  big->Data()[16383] = 9;  // a reader of the larger size keeps every byte
  EXPECT_EQ(big->Data()[16383], 9);

  // A larger request grows the existing object.
  auto larger = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(larger->Create(name, 32768));
  EXPECT_EQ(DevShmSize(name), 32768);
  larger->Data()[32767] = 3;
  EXPECT_EQ(larger->Data()[16383], 9);
}

TEST_F(SharedCpuMemoryTest, ReCreateReleasesTheOldNameFirst) {
  const std::string first = UniqueName();
  const std::string second = UniqueName();
  auto segment = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(segment->Create(first, 4096));
  ASSERT_TRUE(segment->Create(second, 8192));
  EXPECT_FALSE(DevShmHas(first));
  EXPECT_TRUE(DevShmHas(second));
  EXPECT_EQ(segment->Size(), 8192u);
}

TEST_F(SharedCpuMemoryTest, CreateWithoutANameMakesAUniqueOne) {
  auto a = pm::SharedCpuMemoryPosix::New();
  auto b = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(a->Create(std::nullopt, 4096));
  ASSERT_TRUE(b->Create(std::nullopt, 4096));
  EXPECT_NE(a->GetName(), b->GetName());
  EXPECT_EQ(a->GetName().size(), 36u + std::strlen(".net.quillfront.pm"));
  EXPECT_TRUE(a->GetName().ends_with(".net.quillfront.pm"));
  EXPECT_TRUE(DevShmHas(a->GetName()));
  const std::string name = a->GetName(), other = b->GetName();
  a.reset();
  b.reset();
  EXPECT_FALSE(DevShmHas(name));
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

TEST_F(SharedCpuMemoryTest, FailedMapLeavesSizeZeroAndNoDescriptor) {
  pmtest::LogCapture log;
  const std::string name = UniqueName();
  auto creator = pm::SharedCpuMemoryPosix::New();
  ASSERT_TRUE(creator->Create(name, 4096));
  const int descriptorsBefore = OpenDescriptors();

  // Asking for more than the object holds would fault past its end.
  auto opener = pm::SharedCpuMemoryPosix::New();
  EXPECT_FALSE(opener->Open(name, 8192));
  EXPECT_EQ(log.Count("SharedCpuMemoryWin::MapFile cannot map view of file (22).\n"), 1);
  EXPECT_EQ(opener->Size(), 0u);
  EXPECT_EQ(opener->Data(), nullptr);
  EXPECT_EQ(OpenDescriptors(), descriptorsBefore);
  EXPECT_EQ(DevShmSize(name), 4096);

  // A zero-byte segment cannot be mapped; its fresh name goes again.
  log.Clear();
  const std::string empty = UniqueName();
  auto zero = pm::SharedCpuMemoryPosix::New();
  EXPECT_FALSE(zero->Create(empty, 0));
  EXPECT_EQ(log.Count("SharedCpuMemoryWin::MapFile cannot map view of file (22).\n"), 1);
  EXPECT_EQ(zero->Size(), 0u);
  EXPECT_FALSE(DevShmHas(empty));
  EXPECT_EQ(OpenDescriptors(), descriptorsBefore);
}

TEST_F(SharedCpuMemoryTest, UnusableNamesFailWithTheLogLineAndLeakNothing) {
  pmtest::LogCapture log;
  const int descriptorsBefore = OpenDescriptors();
  auto segment = pm::SharedCpuMemoryPosix::New();
  const std::string slash = Prefix() + "a/b";
  EXPECT_FALSE(segment->Create(slash, 4096));
  EXPECT_TRUE(log.Contains("SharedCpuMemoryWin::Create : Could not create '" + slash + "' (22).\n"));
  const std::string tooLong = Prefix() + std::string(300, 'x');
  EXPECT_FALSE(segment->Create(tooLong, 4096));
  // The C library reports EINVAL or ENAMETOOLONG, depending on its version.
  EXPECT_TRUE(log.Contains("SharedCpuMemoryWin::Create : Could not create '" + tooLong + "' ("));
  EXPECT_EQ(segment->Size(), 0u);
  EXPECT_EQ(segment->Data(), nullptr);

  const std::string missing = UniqueName();
  EXPECT_FALSE(segment->Open(missing, 4096));
  EXPECT_TRUE(log.Contains("SharedCpuMemoryWin::Create : Could not open '" + missing + "' (2).\n"));
  EXPECT_EQ(log.Lines().size(), 3u);
  EXPECT_EQ(OpenDescriptors(), descriptorsBefore);
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

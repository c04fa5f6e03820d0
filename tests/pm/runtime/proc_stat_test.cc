// /proc/PID/stat as the liveness checks and CPU figures read it: a live
// process, a child that ended but is not reaped yet (a zombie, which still
// answers kill(pid, 0)), and one that is gone.
#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <string>
#include <tuple>

#include "pm/runtime/proc_stat.h"
#include "pm/runtime/system.h"

namespace {

TEST(ProcStat, ReadsALiveProcessAZombieChildAndNothingOfOneGone) {
  std::string command;
  std::getline(std::ifstream("/proc/self/comm"), command);
  pm::ProcStat self;
  ASSERT_TRUE(pm::ReadProcStat(::getpid(), &self));
  EXPECT_EQ(std::tie(self.command, self.state, self.parent), std::make_tuple(command, 'R', ::getppid()));
  EXPECT_TRUE(pm::ProcessAlive(::getpid()));
  // Busy until a clock tick of CPU time was used (10 ms).
  const auto limit = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (pm::ProcessCpuSeconds(::getpid()) == 0 && std::chrono::steady_clock::now() < limit) {
  }
  EXPECT_GT(pm::ProcessCpuSeconds(::getpid()), 0);

  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) ::_exit(0);
  pm::ProcStat ended;
  while (pm::ReadProcStat(child, &ended) && ended.state != 'Z') ::usleep(1000);
  EXPECT_EQ(std::tie(ended.state, ended.parent), std::make_tuple('Z', ::getpid()));
  EXPECT_FALSE(pm::ProcessAlive(child));
  EXPECT_EQ(pm::ChildrenNamed(::getpid(), command), std::vector<pid_t>{child});
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_FALSE(pm::ReadProcStat(child, &ended));
  EXPECT_EQ(pm::ProcessCpuSeconds(child), 0);
  EXPECT_FALSE(pm::ProcessAlive(child));
  EXPECT_TRUE(pm::ChildrenNamed(::getpid(), command).empty());
}

}  // namespace

#include "platform/linux/process/LinuxProcessInfo.h"

#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>

#include <gtest/gtest.h>

namespace tavrin {
namespace {

TEST(LinuxProcessInfoTest, CommandNamesOfLiveProcessesAndNothingForOthers) {
  LinuxProcessInfo info;
  EXPECT_EQ(info.OwnProcessIdentifier(), getpid());
  char original[16] = {};
  prctl(PR_GET_NAME, original);
  prctl(PR_SET_NAME, "audio-client-with-a-long-name");  // the kernel keeps 15 characters
  EXPECT_EQ(info.OwnProcessName(), "audio-client-wi");
  EXPECT_EQ(info.CommandName(getpid()), "audio-client-wi");
  prctl(PR_SET_NAME, original);

  const pid_t gone = fork();
  if (gone == 0) _exit(0);
  ASSERT_EQ(waitpid(gone, nullptr, 0), gone);  // reaped: no record left
  // pid_max is at most 2^22, so the last one cannot exist.
  for (int32_t pid : {gone, 0, -1, INT32_MIN, INT32_MAX}) {
    EXPECT_EQ(info.CommandName(pid), std::nullopt) << pid;
  }
}

}  // namespace
}  // namespace tavrin

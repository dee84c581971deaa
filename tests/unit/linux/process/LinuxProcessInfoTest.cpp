#include "platform/linux/process/LinuxProcessInfo.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <fstream>
#include <string>

namespace tavrin {
namespace {

std::string ReadComm(const std::string& path) {
  std::ifstream in(path);
  std::string name;
  std::getline(in, name);
  return name;
}

TEST(LinuxProcessInfoTest, OwnProcessIdentifierAndName) {
  LinuxProcessInfo info;
  EXPECT_EQ(info.OwnProcessIdentifier(), ::getpid());
  const std::string name = info.OwnProcessName();
  EXPECT_EQ(name, ReadComm("/proc/self/comm"));
  EXPECT_FALSE(name.empty());
  EXPECT_EQ(name.find('\n'), std::string::npos);
  EXPECT_EQ(info.CommandName(::getpid()), name);
}

// A child that renames itself, tells the parent, and waits to be killed.
class NamedChild {
 public:
  explicit NamedChild(const char* name) {
    int ready[2];
    if (::pipe(ready) != 0) return;
    pid_ = ::fork();
    if (pid_ == 0) {
      ::prctl(PR_SET_NAME, name, 0, 0, 0);
      const char byte = 1;
      (void)!::write(ready[1], &byte, 1);
      for (;;) ::pause();
    }
    ::close(ready[1]);
    char byte = 0;
    (void)!::read(ready[0], &byte, 1);
    ::close(ready[0]);
  }
  ~NamedChild() { Reap(); }
  void Reap() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }
  pid_t Pid() const { return pid_; }

 private:
  pid_t pid_ = -1;
};

TEST(LinuxProcessInfoTest, ChildCommandNameAndItsLongestForm) {
  LinuxProcessInfo info;
  NamedChild child("tavrin-client");
  ASSERT_GT(child.Pid(), 0);
  EXPECT_EQ(info.CommandName(child.Pid()), "tavrin-client");

  // The kernel keeps 15 characters of a longer name.
  NamedChild longer("audio-client-with-a-long-name");
  ASSERT_GT(longer.Pid(), 0);
  EXPECT_EQ(info.CommandName(longer.Pid()), "audio-client-wi");

  const pid_t gone = child.Pid();
  child.Reap();
  EXPECT_EQ(info.CommandName(gone), std::nullopt) << "a reaped process has no record";
}

TEST(LinuxProcessInfoTest, NoNameForImpossibleOrAbsentProcesses) {
  LinuxProcessInfo info;
  EXPECT_EQ(info.CommandName(0), std::nullopt);
  EXPECT_EQ(info.CommandName(-1), std::nullopt);
  EXPECT_EQ(info.CommandName(INT32_MIN), std::nullopt);
  // pid_max is at most 2^22, so this pid cannot exist.
  EXPECT_EQ(info.CommandName(INT32_MAX), std::nullopt);
}

}  // namespace
}  // namespace tavrin

// A process image read through /proc, against real processes: exec and exit
// must both read as a change, and nothing else may.
#include "platform/ProcessImage.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "platform/ProcessAttachPolicy.h"

namespace berth {
namespace {

// A child that waits for a byte on a pipe, then execs "sleep 5"; killed and
// reaped when the object goes.
class WaitingChild {
  public:
    WaitingChild() {
        int fds[2];
        if (::pipe2(fds, O_CLOEXEC) != 0) return;
        pid_ = ::fork();
        if (pid_ == 0) {
            char byte;
            if (::read(fds[0], &byte, 1) == 1) ::execlp("sleep", "sleep", "5", nullptr);
            _exit(1);
        }
        ::close(fds[0]);
        go_ = fds[1];
        procDirectory_ =
            ::open(("/proc/" + std::to_string(pid_)).c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    }
    ~WaitingChild() {
        if (go_ >= 0) ::close(go_);
        if (procDirectory_ >= 0) ::close(procDirectory_);
        if (pid_ > 0 && !reaped_) {
            ::kill(pid_, SIGKILL);
            ::waitpid(pid_, nullptr, 0);
        }
    }
    int procDirectory() const { return procDirectory_; }

    // Lets the child exec and waits until /proc shows the new program.
    bool execAndWait() {
        if (::write(go_, "x", 1) != 1) return false;
        for (int i = 0; i < 500; ++i) {
            char name[64] = {};
            const int fd = ::openat(procDirectory_, "comm", O_RDONLY | O_CLOEXEC);
            const ssize_t n = fd >= 0 ? ::read(fd, name, sizeof name - 1) : -1;
            if (fd >= 0) ::close(fd);
            if (n > 0 && std::string(name) == "sleep\n") return true;
            ::usleep(10000);
        }
        return false;
    }
    // Kills the child; it stays a zombie until reap().
    void kill() { ::kill(pid_, SIGKILL); }
    void reap() {
        ::waitpid(pid_, nullptr, 0);
        reaped_ = true;
    }

  private:
    pid_t pid_ = -1;
    int go_ = -1;
    int procDirectory_ = -1;
    bool reaped_ = false;
};

TEST(ProcessImageTest, AnImageIsUnchangedUntilItsProcessExecsOrExits) {
    if (::geteuid() != 0) GTEST_SKIP() << "reading another process's image needs root";
    WaitingChild child;
    ASSERT_GE(child.procDirectory(), 0);
    const ProcessImage before = ProcessImage::of(child.procDirectory());
    if (!before.valid() && processAttachRestriction() == 3)
        GTEST_SKIP() << "the kernel's attach restriction (level 3) refuses memory files to root";
    ASSERT_TRUE(before.valid());
    EXPECT_TRUE(before.unchanged());
    EXPECT_TRUE(before.unchanged());  // reading it leaves it as it is

    ASSERT_TRUE(child.execAndWait());
    EXPECT_FALSE(before.unchanged());
    const ProcessImage after = ProcessImage::of(child.procDirectory());
    ASSERT_TRUE(after.valid());
    EXPECT_TRUE(after.unchanged());

    // A zombie runs nothing any more, and neither does a reaped process.
    child.kill();
    for (int i = 0; i < 500 && after.unchanged(); ++i) ::usleep(10000);
    EXPECT_FALSE(after.unchanged());
    child.reap();
    EXPECT_FALSE(after.unchanged());
    EXPECT_FALSE(ProcessImage::of(child.procDirectory()).valid());
}

TEST(ProcessImageTest, WithoutAProcessDirectoryThereIsNoImageAndNoAnswer) {
    const ProcessImage none = ProcessImage::of(-1);
    EXPECT_FALSE(none.valid());
    EXPECT_FALSE(none.unchanged());
}

}  // namespace
}  // namespace berth

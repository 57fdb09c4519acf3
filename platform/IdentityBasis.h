// What a peer's identity was read from, so that the next request of the same
// connection can tell, with a few stat calls, that evaluating the identity
// anew would give the same answer.
//
// An identity rests on files and directories: the executable a root peer
// runs and the path it is signed by, the registry entry and every directory
// whose ownership made it trusted, a launch record and its directories, the
// control groups (and their "cgroup.procs") whose ownership proved who
// placed the process. Each is recorded as the evaluation saw it, by a path
// it can be found at again, before its contents were read. Any later write,
// rename, replacement, removal, chmod or chown gives another version at that
// path, so a basis that still holds stands for an evaluation that would
// read the same bytes under the same owners.
//
// With a ChangeWatch, the files and directories are checked by the watch
// while it has seen no change (one call), and stat'ed one by one only when it
// has, or may have: the executable (whose contents a memory mapping could
// change unseen), the control group and the process are checked every time.
// The executable is checked without /proc while the process's image, opened
// before the evaluation, is unchanged (see ProcessImage): the process then
// still runs the very file recorded, whose version one fstat of it tells.
//
// Contents are told apart by their change time, which only the kernel sets.
// A regular file changed within `window` of its recording could change again
// within the same timestamp tick and keep its version; a basis holding such
// a file is not settled, and the identity is then evaluated anew next time.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/ChangeWatch.h"
#include "platform/ExecutableIdentity.h"
#include "platform/ProcessImage.h"
#include "platform/UniqueFd.h"

namespace berth {

class IdentityBasis {
  public:
    // Records `path` as `status` shows it; `status` must come from the very
    // object the evaluation went on to trust or read.
    void record(std::filesystem::path path, const struct stat& status);
    // Records the file the process runs, as /proc/<pid>/exe resolves it;
    // `file`, when given, is that very file open.
    void recordExecutable(const struct stat& status, UniqueFd file = {});
    // Records the control group the process was found in.
    void recordCgroup(std::string cgroup);

    // Called once the evaluation is over: the basis is settled when
    // something was recorded and no regular file among it changed within
    // `window` of now.
    void settle(std::chrono::nanoseconds window);
    // Only a settled basis may stand for a later evaluation.
    bool settled() const { return settled_; }

    // Lets holds() rely on `watch` for the files and directories recorded,
    // from now on.
    void watchWith(std::shared_ptr<ChangeWatch> watch);

    // Whether everything recorded is still as it was, for the process `pid`
    // that `pidfd` refers to; /proc is read last. With `procDirectory` (its
    // /proc directory, opened while it lived) /proc is read through that,
    // which shows nothing once the process is gone; without it, through
    // /proc/<pid>, and the pidfd then confirms the process afterwards, so
    // what /proc showed was its own. `image`, when given, was opened before
    // the evaluation this basis records. Not safe to call from two threads
    // at once.
    bool holds(pid_t pid, int pidfd, int procDirectory = -1, const ProcessImage* image = nullptr);

  private:
    // Whether every recorded file and directory is as it was; watches them
    // anew when the watch saw a change, or may have.
    bool filesHold();
    // Whether the process still runs the recorded executable, as it was.
    bool executableHolds(int procDirectory, const ProcessImage* image) const;

    std::vector<std::pair<std::filesystem::path, FileVersion>> files_;
    std::optional<FileVersion> executable_;
    UniqueFd executableFile_;
    std::optional<std::string> cgroup_;
    bool settled_ = false;
    std::shared_ptr<ChangeWatch> watch_;
    // Set while the watch stands for the files: all of them watched and
    // found as recorded after `watchedSince`.
    bool watched_ = false;
    uint64_t watchedSince_ = 0;
};

}  // namespace berth

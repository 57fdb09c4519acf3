// The sandbox berth-launch starts a program in: the bubblewrap command line
// for a program, the directories the daemon answered and the persona.
//
// The sandbox's file system is built from nothing: the system's own
// directories read-only (/usr and the /bin, /sbin, /lib* links or
// directories, /etc), fresh /dev, /proc and /tmp, then the application's
// containers read-write at their own paths, the daemon's request socket at
// the path a program looks for it, and nothing else of the device root, so no
// other container, no class directory's listing and none of the daemon's
// state is visible. Every directory is bound from a descriptor the launcher
// opened without following links, and the program itself from the
// descriptor its signature was checked through, so what it checked is what
// the program gets.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace berth::launch {

// A directory or file to bind: an open descriptor and where it appears.
struct Binding {
    int fd = -1;
    std::string destination;
    bool writable = true;
};

struct SandboxPlan {
    std::vector<Binding> bindings;
    // The launcher's own program inside the sandbox (bound read-only at
    // kHelperPath), which drops to the persona and runs the program.
    int helperFd = -1;
    // The program, as opened for its signature check, bound read-only over
    // its own path; and the daemon's request socket (-1: none).
    int programFd = -1;
    int requestSocketFd = -1;
    uid_t uid = 0;
    gid_t gid = 0;
    std::vector<std::pair<std::string, std::string>> environment;
    std::string workingDirectory;
    std::vector<std::string> program;  // the program and its arguments
};

inline constexpr const char* kHelperPath = "/run/berth-launch";
// Where a program finds the daemon's request socket (the device root is "/"
// inside the sandbox).
inline constexpr const char* kRequestSocketPath = "/run/berthd/sys.kelp.berthd";

// The command line of bwrap (without the program name) for `plan`. Parent
// directories of bound paths that the sandbox has to make are made mode
// 0755, so the persona can reach its containers.
std::vector<std::string> bubblewrapArguments(const SandboxPlan& plan);

// Every ancestor of `path` from the top ("/a", "/a/b" for "/a/b/c").
std::vector<std::string> ancestorsOf(const std::string& path);

}  // namespace berth::launch

#include "Sandbox.h"

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <set>

namespace berth::launch {

namespace {

// The system's directories, as the host has them: a link (merged /usr) is
// made the same link, a directory is bound read-only.
void addSystemDirectories(std::vector<std::string>& args) {
    args.insert(args.end(), {"--ro-bind", "/usr", "/usr"});
    for (const char* name : {"/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32"}) {
        char target[4096];
        const ssize_t n = ::readlink(name, target, sizeof target - 1);
        if (n > 0) {
            args.insert(args.end(), {"--symlink", std::string(target, n), name});
        } else {
            args.insert(args.end(), {"--ro-bind-try", name, name});
        }
    }
    args.insert(args.end(), {"--ro-bind-try", "/etc", "/etc", "--dev", "/dev", "--proc", "/proc",
                             "--tmpfs", "/tmp", "--perms", "0755", "--dir", "/run"});
}

bool isSystemPath(const std::string& path) {
    for (const char* top : {"/usr", "/etc", "/dev", "/proc", "/run"})
        if (path == top || path.rfind(std::string(top) + "/", 0) == 0) return true;
    return path == "/tmp";
}

}  // namespace

std::vector<std::string> ancestorsOf(const std::string& path) {
    std::vector<std::string> result;
    for (size_t slash = path.find('/', 1); slash != std::string::npos;
         slash = path.find('/', slash + 1))
        result.push_back(path.substr(0, slash));
    return result;
}

std::vector<std::string> bubblewrapArguments(const SandboxPlan& plan) {
    std::vector<std::string> args = {"--unshare-pid", "--unshare-ipc",     "--unshare-uts",
                                     "--new-session", "--die-with-parent", "--clearenv"};
    addSystemDirectories(args);
    std::set<std::string> made;
    for (const Binding& binding : plan.bindings) {
        for (const std::string& ancestor : ancestorsOf(binding.destination)) {
            if (isSystemPath(ancestor) || !made.insert(ancestor).second) continue;
            args.insert(args.end(), {"--perms", "0755", "--dir", ancestor});
        }
        args.insert(args.end(), {binding.writable ? "--bind-fd" : "--ro-bind-fd",
                                 std::to_string(binding.fd), binding.destination});
    }
    if (plan.programFd >= 0 && !plan.program.empty())
        args.insert(args.end(), {"--ro-bind-fd", std::to_string(plan.programFd), plan.program[0]});
    if (plan.requestSocketFd >= 0) {
        const std::string directory = std::filesystem::path(kRequestSocketPath).parent_path();
        args.insert(args.end(), {"--perms", "0755", "--dir", directory, "--bind-fd",
                                 std::to_string(plan.requestSocketFd), kRequestSocketPath});
    }
    args.insert(args.end(), {"--ro-bind-fd", std::to_string(plan.helperFd), kHelperPath});
    for (const auto& [name, value] : plan.environment)
        args.insert(args.end(), {"--setenv", name, value});
    if (!plan.workingDirectory.empty()) args.insert(args.end(), {"--chdir", plan.workingDirectory});
    args.insert(args.end(), {"--", kHelperPath, "--as-persona", std::to_string(plan.uid),
                             std::to_string(plan.gid), "--"});
    args.insert(args.end(), plan.program.begin(), plan.program.end());
    return args;
}

}  // namespace berth::launch

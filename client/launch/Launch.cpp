#include "Launch.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/capability.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <optional>
#include <thread>

#include "Sandbox.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/DeviceRoot.h"
#include "platform/LaunchCgroup.h"
#include "platform/LaunchRecord.h"
#include "platform/RelaunchBlock.h"
#include "platform/RootOwnedFiles.h"
#include "platform/SafeFs.h"
#include "platform/ServiceCheckIn.h"
#include "platform/UniqueFd.h"
#include "platform/UserDatabase.h"

namespace berth::launch {

namespace {

namespace stdfs = std::filesystem;

int fail(std::ostream& err, const std::string& message, int status = kExitLaunchFailed) {
    err << "berth-launch: " << message << "\n";
    return status;
}

int refuseHeld(std::ostream& err, const std::string& identifier, const std::string& reason) {
    return fail(err, identifier + " is held terminated by berthd (" + reason +
                         "); it cannot be launched until the termination assertion is released");
}

bool isExecutable(const stdfs::path& path) {
    struct stat st {};
    return ::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) && (st.st_mode & 0111);
}

// `name` itself when it holds a slash, else the first executable of that
// name in PATH; absolute and with links resolved.
std::optional<stdfs::path> findProgram(const std::string& name) {
    std::error_code ec;
    if (name.find('/') != std::string::npos) {
        stdfs::path found = stdfs::canonical(name, ec);
        return !ec && isExecutable(found) ? std::optional(found) : std::nullopt;
    }
    const char* path = std::getenv("PATH");
    std::string directories = path ? path : "/usr/local/bin:/usr/bin:/bin";
    size_t start = 0;
    while (start <= directories.size()) {
        const size_t end = std::min(directories.find(':', start), directories.size());
        const stdfs::path candidate = stdfs::path(directories.substr(start, end - start)) / name;
        if (end > start && isExecutable(candidate)) {
            stdfs::path found = stdfs::canonical(candidate, ec);
            if (!ec) return found;
        }
        start = end + 1;
    }
    return std::nullopt;
}

// A program the sandbox's system directories already hold.
bool isSystemProgram(const stdfs::path& program) {
    const std::string text = program.string();
    for (const char* top : {"/usr/", "/etc/", "/bin/", "/sbin/"})
        if (text.rfind(top, 0) == 0) return true;
    return false;
}

// The program to run, opened once: the file checked against its signature
// is the file the sandbox runs.
struct SignedProgram {
    UniqueFd fd;
    stdfs::path path;
    Sha256Digest digest{};
};

// Opens `path` and requires it to be signed as `identifier` with its present
// contents, and to be root's alone, so that nobody but root can change it
// between the check and its end.
std::optional<SignedProgram> checkSignature(const stdfs::path& path, const std::string& identifier,
                                            std::ostream& err) {
    SignedProgram program{fs::openNoFollow(path, O_RDONLY | O_NONBLOCK | O_NOCTTY), path, {}};
    struct stat status {};
    if (!program.fd || ::fstat(program.fd.get(), &status) != 0) {
        fail(err, "cannot open " + path.string() + ": " + std::strerror(errno));
        return std::nullopt;
    }
    if (!S_ISREG(status.st_mode) || !isRootsAlone(status)) {
        fail(err, path.string() +
                      " can be changed by users other than root; only a program owned by root and "
                      "writable by nobody else can be launched");
        return std::nullopt;
    }
    std::string why;
    const std::optional<Sha256Digest> digest = sha256OfFile(program.fd.get(), &why);
    if (!digest) {
        fail(err, "cannot read " + path.string() + ": " + why);
        return std::nullopt;
    }
    program.digest = *digest;
    const std::optional<SignatureEntry> entry = CodeSigningRegistry().entryFor(path, &why);
    if (!entry) {
        fail(err, "cannot launch " + path.string() + " as " + identifier + ": " + why +
                      " (berthctl sign " + path.string() + " " + identifier + ")");
        return std::nullopt;
    }
    if (entry->identifier != identifier) {
        fail(err, path.string() + " is signed as " + entry->identifier + ", not " + identifier);
        return std::nullopt;
    }
    if (entry->digest != program.digest) {
        fail(err, "the contents of " + path.string() + " do not match its signature");
        return std::nullopt;
    }
    return program;
}

// Asks the daemon for the application's directories.
std::optional<upcall::Reply> askDaemon(const LaunchOptions& options, std::ostream& err) {
    const std::string socket =
        options.socket.empty()
            ? (ServiceCheckIn::runtimeDirectory() / "sys.kelp.berthd.upcall").string()
            : options.socket;
    upcall::CallFailure failure;
    std::optional<upcall::Answer> answer = upcall::call(options.request, socket, &failure);
    if (!answer) {
        if (failure.stage == upcall::CallFailure::Stage::Connect &&
            (failure.error == ENOENT || failure.error == ECONNREFUSED))
            fail(err, "berthd is not running on the device root " + DeviceRoot::path().string() +
                          " (cannot connect to " + socket + ": " + std::strerror(failure.error) +
                          ")");
        else if (failure.stage == upcall::CallFailure::Stage::Decode)
            fail(err, "unreadable answer from berthd: " + failure.detail);
        else
            fail(err, "cannot ask berthd on " + socket + ": " + std::strerror(failure.error));
        return std::nullopt;
    }
    if (answer->returnCode != 0) {
        fail(err, "berthd refused the request with return code " +
                      std::to_string(answer->returnCode) + ": " +
                      upcall::returnCodeText(answer->returnCode));
        return std::nullopt;
    }
    if (!answer->reply.success || !answer->reply.dataContainer) {
        fail(err, "berthd could not provide every container of " +
                      options.request.signingIdentifier + " (success 0)");
        return std::nullopt;
    }
    return std::move(answer->reply);
}

// The directories the program gets, each opened without following a link;
// one inside another already bound (tmp inside the data container) comes
// with it.
bool openContainers(const upcall::Reply& reply, std::vector<UniqueFd>* fds,
                    std::vector<Binding>* bindings, std::ostream& err) {
    std::vector<std::string> paths = {*reply.dataContainer};
    if (reply.tmp) paths.push_back(*reply.tmp);
    for (const auto& [identifier, path] : reply.groups) paths.push_back(path);
    if (reply.systemContainer) paths.push_back(*reply.systemContainer);
    for (const auto& [identifier, path] : reply.systemGroups) paths.push_back(path);
    for (const std::string& path : paths) {
        bool covered = false;
        for (const Binding& bound : *bindings)
            covered =
                covered || path == bound.destination || path.rfind(bound.destination + "/", 0) == 0;
        if (covered) continue;
        UniqueFd fd = fs::openNoFollow(path, O_PATH | O_DIRECTORY);
        if (!fd) {
            fail(err, "cannot open the container " + path + ": " + std::strerror(errno));
            return false;
        }
        bindings->push_back({fd.get(), path, true});
        fds->push_back(std::move(fd));
    }
    return true;
}

// In the forked child: into the launch's group, the launch recorded (the
// child is in the group, so a record always names a group that holds its
// launch until the launch ends), the block checked once more (an assertion
// taken meanwhile killed the group before this process was in it, so it
// must be caught here), then bubblewrap.
[[noreturn]] void startSandbox(const LaunchGroup& launch, const LaunchRecord& record,
                               const std::vector<std::string>& argv,
                               const std::vector<int>& inherited) {
    if (const int code = LaunchCgroup::join(launch.fd.get())) {
        fail(std::cerr, "cannot join the launch cgroup: " + std::string(std::strerror(code)));
        _exit(kExitLaunchFailed);
    }
    std::string why;
    if (LaunchRecords().write(launch.name, record, &why) != 0) {
        fail(std::cerr, "cannot record the launch: " + why);
        _exit(kExitLaunchFailed);
    }
    if (std::optional<std::string> reason = RelaunchBlocks().reasonFor(record.identifier))
        _exit(refuseHeld(std::cerr, record.identifier, *reason));
    for (int fd : inherited) ::fcntl(fd, F_SETFD, 0);
    std::vector<char*> pointers;
    for (const std::string& arg : argv) pointers.push_back(const_cast<char*>(arg.c_str()));
    pointers.push_back(nullptr);
    ::execv(pointers[0], pointers.data());
    fail(std::cerr, "cannot run " + argv[0] + ": " + std::strerror(errno));
    _exit(kExitLaunchFailed);
}

// Removes the launch's record and group, and the application's group unless
// another launch of it still runs there. The kernel counts a reaped program
// in its group a moment longer, so a busy group is tried again for half a
// second.
void removeLaunch(const LaunchCgroup& cgroups, const std::string& identifier,
                  const std::string& launch) {
    LaunchRecords().remove(launch);
    for (int attempt = 0; attempt < 50 && cgroups.removeLaunch(identifier, launch) == EBUSY;
         ++attempt)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    cgroups.remove(identifier);
}

// Removes the records (and groups) of launches that ended without their
// launcher cleaning up (it was killed): a record whose group is gone, is
// another group, or holds nothing any more.
void pruneEndedLaunches(const LaunchCgroup& cgroups) {
    const LaunchRecords records;
    for (const std::string& launch : records.launches()) {
        const std::optional<LaunchRecord> record = records.read(launch);
        if (record && cgroups.holdsProcesses(record->cgroup, record->cgroupId)) continue;
        records.remove(launch);
        if (!record || !record->cgroup.ends_with("/" + launch)) continue;
        const stdfs::path group = cgroups.mount() / record->cgroup;
        if (::rmdir(group.c_str()) == 0) ::rmdir(group.parent_path().c_str());
    }
}

// What must be there before the daemon is asked.
struct Prerequisites {
    stdfs::path bwrap;
    LaunchCgroup cgroups;
    UserRecord user;
    SignedProgram program;
};

std::optional<Prerequisites> checkPrerequisites(const LaunchOptions& options, int* status,
                                                std::ostream& err) {
    const std::string& identifier = options.request.signingIdentifier;
    std::string why;
    *status = kExitLaunchFailed;
    if (::geteuid() != 0) {
        fail(err,
             "must run as root (it asks berthd as the kernel does and starts programs as "
             "other users)");
        return std::nullopt;
    }
    if (!LaunchCgroup::validName(identifier, &why)) {
        *status = fail(err, why, kExitUsage);
        return std::nullopt;
    }
    const std::optional<stdfs::path> bwrap = findProgram("bwrap");
    if (!bwrap) {
        fail(err, "bubblewrap is not installed (no bwrap in PATH); install the package bubblewrap");
        return std::nullopt;
    }
    std::optional<LaunchCgroup> cgroups =
        LaunchCgroup::locate(LaunchCgroup::configuredParent(), &why);
    if (!cgroups) {
        fail(err, why);
        return std::nullopt;
    }
    if (std::optional<std::string> reason = RelaunchBlocks().reasonFor(identifier)) {
        refuseHeld(err, identifier, *reason);
        return std::nullopt;
    }
    std::optional<UserRecord> user = UserDatabase::userById(options.request.persona);
    if (!user) {
        fail(err, "no user with uid " + std::to_string(options.request.persona) +
                      " in the device's user database");
        return std::nullopt;
    }
    const std::optional<stdfs::path> found = findProgram(options.program.at(0));
    if (!found) {
        *status = fail(err, "program not found: " + options.program[0], kExitNotFound);
        return std::nullopt;
    }
    std::optional<SignedProgram> program = checkSignature(*found, identifier, err);
    if (!program) return std::nullopt;
    return Prerequisites{*bwrap, std::move(*cgroups), std::move(*user), std::move(*program)};
}

// The sandbox for the answered directories; the descriptors it binds go to
// `fds`.
std::optional<SandboxPlan> planSandbox(const LaunchOptions& options, const Prerequisites& pre,
                                       const upcall::Reply& reply, std::vector<UniqueFd>* fds,
                                       std::ostream& err) {
    SandboxPlan plan;
    if (!openContainers(reply, fds, &plan.bindings, err)) return std::nullopt;
    const stdfs::path& program = pre.program.path;
    if (!isSystemProgram(program)) {
        // The program's own directory (its bundle), read-only.
        UniqueFd directory = fs::openNoFollow(program.parent_path(), O_PATH | O_DIRECTORY);
        if (!directory) {
            fail(err,
                 "cannot open " + program.parent_path().string() + ": " + std::strerror(errno));
            return std::nullopt;
        }
        plan.bindings.push_back({directory.get(), program.parent_path().string(), false});
        fds->push_back(std::move(directory));
    }
    plan.programFd = pre.program.fd.get();
    // The daemon's request socket, where the program looks for it.
    UniqueFd socket = fs::openNoFollow(
        ServiceCheckIn::runtimeDirectory() / stdfs::path(kRequestSocketPath).filename(), O_PATH);
    if (socket) {
        plan.requestSocketFd = socket.get();
        fds->push_back(std::move(socket));
    }
    UniqueFd helper(::open("/proc/self/exe", O_PATH | O_CLOEXEC));
    if (!helper) {
        fail(err, "cannot open its own program: " + std::string(std::strerror(errno)));
        return std::nullopt;
    }
    plan.helperFd = helper.get();
    fds->push_back(std::move(helper));
    plan.uid = pre.user.uid;
    plan.gid = pre.user.gid;
    plan.environment = {{"PATH", "/usr/local/bin:/usr/bin:/bin"},
                        {"USER", pre.user.name},
                        {"LOGNAME", pre.user.name},
                        {"BERTH_DATA_CONTAINER", *reply.dataContainer}};
    if (reply.home) plan.environment.emplace_back("HOME", *reply.home);
    if (reply.tmp) plan.environment.emplace_back("TMPDIR", *reply.tmp);
    plan.workingDirectory = *reply.dataContainer;
    plan.program = options.program;
    plan.program[0] = program.string();
    return plan;
}

// No program run later may regain a capability (needs privileges: before
// the uid changes).
bool dropBoundingSet() {
    for (int cap = 0; cap <= CAP_LAST_CAP; ++cap)
        if (::prctl(PR_CAPBSET_DROP, cap, 0, 0, 0) != 0 && errno != EINVAL) return false;
    return ::prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0) == 0;
}

// Empties the process's own capability sets, which a uid 0 persona keeps.
bool clearCapabilities() {
    struct __user_cap_header_struct header {
        _LINUX_CAPABILITY_VERSION_3, 0
    };
    struct __user_cap_data_struct data[2] = {};
    return ::syscall(SYS_capset, &header, data) == 0;
}

}  // namespace

int runLaunch(const LaunchOptions& options, std::ostream& err) {
    const std::string& identifier = options.request.signingIdentifier;
    int status = 0;
    const std::optional<Prerequisites> pre = checkPrerequisites(options, &status, err);
    if (!pre) return status;
    const std::optional<upcall::Reply> reply = askDaemon(options, err);
    if (!reply) return kExitLaunchFailed;
    std::vector<UniqueFd> fds;
    const std::optional<SandboxPlan> plan = planSandbox(options, *pre, *reply, &fds, err);
    if (!plan) return kExitLaunchFailed;

    std::vector<std::string> argv = {pre->bwrap.string()};
    for (std::string& arg : bubblewrapArguments(*plan)) argv.push_back(std::move(arg));
    std::vector<int> inherited = {pre->program.fd.get()};
    for (const UniqueFd& fd : fds) inherited.push_back(fd.get());

    pruneEndedLaunches(pre->cgroups);
    const std::optional<LaunchGroup> launch = pre->cgroups.createLaunch(identifier);
    if (!launch)
        return fail(err, "cannot create a launch cgroup under " +
                             pre->cgroups.pathOf(identifier).string() + ": " +
                             std::strerror(errno));
    const LaunchRecord record{identifier,    pre->program.path, pre->program.digest,
                              pre->user.uid, launch->path,      launch->id};
    const pid_t pid = ::fork();
    if (pid < 0) {
        const int error = errno;
        removeLaunch(pre->cgroups, identifier, launch->name);
        return fail(err, "fork: " + std::string(std::strerror(error)));
    }
    if (pid == 0) startSandbox(*launch, record, argv, inherited);
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    removeLaunch(pre->cgroups, identifier, launch->name);
    if (WIFSIGNALED(status)) {
        err << "berth-launch: " << identifier << " ended by signal " << WTERMSIG(status) << "\n";
        return 128 + WTERMSIG(status);
    }
    return WEXITSTATUS(status);
}

int runAsPersona(uid_t uid, gid_t gid, const std::vector<std::string>& program, std::ostream& err) {
    if (::setgroups(1, &gid) != 0 || ::setresgid(gid, gid, gid) != 0 || !dropBoundingSet() ||
        ::setresuid(uid, uid, uid) != 0 || ::getuid() != uid || ::geteuid() != uid ||
        !clearCapabilities())
        return fail(err, "cannot become uid " + std::to_string(uid) +
                             " without privileges: " + std::strerror(errno));
    // No way back to privileges through a set-user-id program.
    ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0);
    std::vector<char*> pointers;
    for (const std::string& arg : program) pointers.push_back(const_cast<char*>(arg.c_str()));
    pointers.push_back(nullptr);
    ::execv(pointers[0], pointers.data());
    const int error = errno;
    return fail(err, "cannot run " + program[0] + ": " + std::strerror(error),
                error == ENOENT ? kExitNotFound : kExitNotExecutable);
}

}  // namespace berth::launch

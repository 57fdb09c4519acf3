#include "platform/RelaunchBlock.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/SafeFs.h"
#include "platform/ServiceCheckIn.h"

namespace berth {

namespace {

bool validName(const std::string& identifier) {
    return !identifier.empty() && identifier != "." && identifier != ".." &&
           identifier.find('/') == std::string::npos && identifier[0] != '.';
}

UniqueFd openDirectory(const std::filesystem::path& directory, bool create) {
    if (create) {
        const int made = fs::makePath(directory, 0755);
        if (made != 0 && made != EEXIST) {
            errno = made;
            return {};
        }
    }
    return fs::openNoFollow(directory, O_RDONLY | O_DIRECTORY);
}

}  // namespace

std::filesystem::path RelaunchBlocks::defaultDirectory() {
    return ServiceCheckIn::runtimeDirectory() / "terminated";
}

int RelaunchBlocks::set(const std::string& identifier, const std::string& reason) const {
    if (!validName(identifier)) return EINVAL;
    UniqueFd directory = openDirectory(directory_, true);
    if (!directory) return errno;
    const std::string aside = "." + identifier + ".new";
    UniqueFd file(::openat(directory.get(), aside.c_str(),
                           O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!file) return errno;
    const std::string text = reason + "\n";
    if (::write(file.get(), text.data(), text.size()) != static_cast<ssize_t>(text.size()) ||
        ::renameat(directory.get(), aside.c_str(), directory.get(), identifier.c_str()) != 0) {
        const int error = errno ? errno : EIO;
        ::unlinkat(directory.get(), aside.c_str(), 0);
        return error;
    }
    return 0;
}

int RelaunchBlocks::clear(const std::string& identifier) const {
    if (!validName(identifier)) return EINVAL;
    UniqueFd directory = openDirectory(directory_, false);
    if (!directory) return errno == ENOENT ? 0 : errno;
    if (::unlinkat(directory.get(), identifier.c_str(), 0) != 0 && errno != ENOENT) return errno;
    return 0;
}

int RelaunchBlocks::clearAll() const {
    UniqueFd directory = openDirectory(directory_, false);
    if (!directory) return errno == ENOENT ? 0 : errno;
    fs::DirReader reader(directory.get());
    int first = 0;
    while (const struct dirent* entry = reader.next())
        if (::unlinkat(directory.get(), entry->d_name, 0) != 0 && errno != ENOENT && !first)
            first = errno;
    return first;
}

std::optional<std::string> RelaunchBlocks::reasonFor(const std::string& identifier) const {
    if (!validName(identifier)) return std::nullopt;
    UniqueFd directory = openDirectory(directory_, false);
    if (!directory) return std::nullopt;
    struct stat st {};
    if (::fstatat(directory.get(), identifier.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0)
        return std::nullopt;
    UniqueFd file(::openat(directory.get(), identifier.c_str(),
                           O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    std::string reason;
    char buffer[256];
    const ssize_t n = file && S_ISREG(st.st_mode) ? ::read(file.get(), buffer, sizeof buffer) : -1;
    if (n > 0) reason.assign(buffer, n);
    while (!reason.empty() && reason.back() == '\n') reason.pop_back();
    return reason.empty() ? std::string("unknown") : reason;
}

}  // namespace berth

// Directory creation, temporary directories, listings and existence tests.
// Removal, copy/move and the tree walk live in the +Remove, +Copy and +Walk
// files.
#include "BTHFileManager.h"

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "BTHFileManager+Internal.h"
#include "platform/ProtectionClass.h"
#include "platform/SafeFs.h"

namespace berth {

using filemanager::errorText;

BTHFileManager& BTHFileManager::defaultManager() {
    static BTHFileManager manager;
    return manager;
}

bool BTHFileManager::createDirectoryAtURL(const std::filesystem::path& url, bool intermediates,
                                          mode_t mode, uid_t owner, int32_t protectionClass,
                                          BTHErrorRef* error) {
    BTH_FUNCTION(
        "-[BTHFileManager createDirectoryAtURL:withIntermediateDirectories:mode:owner:class:"
        "error:]");
    if (intermediates) {
        const int err = fs::makePath(url, mode);
        if (err != 0 && err != EEXIST) {
            BTHSetError(error,
                        BTHMakePOSIXError(err, "mkpath_np of %s failed: %s", url, errorText(err)));
            return false;
        }
    } else {
        std::string name;
        UniqueFd parent = fs::openParentNoFollow(url, &name);
        const int err =
            !parent ? errno : (::mkdirat(parent.get(), name.c_str(), mode) == 0 ? 0 : errno);
        if (err != 0 && err != EEXIST) {
            BTHSetError(error,
                        BTHMakePOSIXError(err, "mkdir of %s failed: %s", url, errorText(err)));
            return false;
        }
    }

    // Class and owner go on the directory as opened here, never through a
    // link that may have replaced it since it was made.
    UniqueFd directory;
    if (protectionClass != -1) {
        directory = fs::openNoFollow(url, O_RDONLY | O_DIRECTORY);
        if (!directory) {
            const int err = errno;
            BTHSetError(error,
                        BTHMakePOSIXError(err, "opendir of %s failed: %s", url, errorText(err)));
            return false;
        }
        if (int err = protection::setClass(directory.get(), protectionClass)) {
            BTHSetError(error, BTHMakePOSIXError(err, "Failed to setclass(%d) on directory %s: %s",
                                                 protectionClass, url, errorText(err)));
            return false;
        }
    }
    if (owner != 0) {
        if (!directory) directory = fs::openNoFollow(url, O_RDONLY | O_DIRECTORY);
        // Ownership is best effort: a directory that keeps its owner is still usable.
        if (directory) (void)::fchown(directory.get(), owner, owner);
    }
    return true;
}

bool BTHFileManager::createDirectoryAtURL(const std::filesystem::path& url, bool intermediates,
                                          mode_t mode, uid_t owner, BTHErrorRef* error) {
    return createDirectoryAtURL(url, intermediates, mode, owner, -1, error);
}

bool BTHFileManager::createDirectoryAtURLWithClass(const std::filesystem::path& url,
                                                   bool intermediates, mode_t mode,
                                                   int32_t protectionClass, BTHErrorRef* error) {
    return createDirectoryAtURL(url, intermediates, mode, 0, protectionClass, error);
}

bool BTHFileManager::createDirectoryAtURL(const std::filesystem::path& url, bool intermediates,
                                          mode_t mode, BTHErrorRef* error) {
    return createDirectoryAtURL(url, intermediates, mode, 0, -1, error);
}

namespace {

// Six characters of the unique suffix, from the kernel's random source.
std::string uniqueSuffix() {
    static constexpr char kAlphabet[] =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
    unsigned char bytes[6];
    size_t got = 0;
    while (got < sizeof bytes) {
        ssize_t n = ::getrandom(bytes + got, sizeof bytes - got, 0);
        if (n > 0) got += static_cast<size_t>(n);
    }
    std::string suffix;
    for (unsigned char b : bytes) suffix += kAlphabet[b % (sizeof kAlphabet - 1)];
    return suffix;
}

}  // namespace

std::optional<BTHFileURL> BTHFileManager::createTemporaryDirectoryInDirectoryURL(
    const std::filesystem::path& parent, const std::string& prefix, BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager createTemporaryDirectoryInDirectoryURL:withNamePrefix:error:]");
    if (error) error->reset();
    const std::filesystem::path templatePath = parent / format("%@XXXXXX", prefix);
    std::string templateName;
    UniqueFd directory = fs::openParentNoFollow(templatePath, &templateName);
    int err = directory ? EEXIST : errno;
    std::string name;
    // As mkdtemp: new names until one is free (a bounded number of tries).
    for (int attempt = 0; directory && err == EEXIST && attempt < 100; ++attempt) {
        name = templateName.substr(0, templateName.size() - 6) + uniqueSuffix();
        err = ::mkdirat(directory.get(), name.c_str(), 0700) == 0 ? 0 : errno;
    }
    if (err != 0) {
        BTHSetError(error, BTHMakePOSIXError(err, "Failed to create temp dir at path %s : %s",
                                             templatePath, errorText(err)));
        return std::nullopt;
    }
    return BTHFileURL{templatePath.parent_path() / name, true};
}

std::optional<BTHFileURL> BTHFileManager::createTemporaryDirectoryInDirectoryURL(
    const std::filesystem::path& parent, BTHErrorRef* error) {
    return createTemporaryDirectoryInDirectoryURL(parent, "temp.", error);
}

namespace {

// The listing's reader: the directory's entries as URLs, hidden names left out.
std::optional<std::vector<BTHFileURL>> iterateDirectory(const std::filesystem::path& directory,
                                                        BTHErrorRef* error) {
    BTH_FUNCTION("_IterateDirectory");
    UniqueFd fd = fs::openNoFollow(directory, O_RDONLY | O_DIRECTORY);
    if (!fd) {
        const int err = errno;
        if (err != ENOENT) BTHLogError("opendir of %s failed: %s", directory, errorText(err));
        BTHSetError(error,
                    BTHMakePOSIXError(err, "opendir of %s failed: %s", directory, errorText(err)));
        return std::nullopt;
    }
    fs::DirReader reader(fd.get());
    std::vector<BTHFileURL> items;
    while (const struct dirent* entry = reader.next()) {
        unsigned char type = entry->d_type;
        if (type == DT_UNKNOWN) {
            // Typed by the item itself; a link stays a link (never followed).
            struct stat st;
            if (::fstatat(fd.get(), entry->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0)
                type = S_ISDIR(st.st_mode)   ? DT_DIR
                       : S_ISLNK(st.st_mode) ? DT_LNK
                       : S_ISREG(st.st_mode) ? DT_REG
                                             : DT_UNKNOWN;
        }
        if (entry->d_name[0] == '.') continue;
        items.push_back({directory / entry->d_name, type == DT_DIR});
    }
    if (errno != 0) {
        const int err = errno;
        BTHSetError(error, BTHMakePOSIXError(err, "_IterateDirectory for %@ returned %s", directory,
                                             errorText(err)));
        return std::nullopt;
    }
    return items;
}

}  // namespace

std::optional<std::vector<BTHFileURL>> BTHFileManager::urlsForItemsInDirectoryAtURL(
    const std::filesystem::path& directory, BTHErrorRef* error) {
    return iterateDirectory(directory, error);
}

bool BTHFileManager::itemExistsAtURL(const std::filesystem::path& url) {
    BTH_FUNCTION("-[BTHFileManager itemExistsAtURL:]");
    const int err = fs::existsNoFollow(url);
    if (err != 0 && err != ENOENT)
        BTHLogError("Failed to determine if %@ exists: %s", url, errorText(err));
    return err == 0;
}

bool BTHFileManager::itemDoesNotExistAtURL(const std::filesystem::path& url) {
    BTH_FUNCTION("-[BTHFileManager itemDoesNotExistAtURL:]");
    const int err = fs::existsNoFollow(url);
    if (err != 0 && err != ENOENT)
        BTHLogError("Failed to determine if %@ exists: %s", url, errorText(err));
    return err == ENOENT;
}

}  // namespace berth

#include "platform/CodeSigningRegistry.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>

#include "core/Uuid.h"
#include "platform/DeviceRoot.h"
#include "platform/PropertyList.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

constexpr const char* kPathKey = "Path";
constexpr const char* kDigestKey = "SHA256";
constexpr const char* kIdentifierKey = "Identifier";
constexpr const char* kEntitlementsKey = "Entitlements";
constexpr const char* kEntrySuffix = ".plist";
constexpr size_t kMaxEntryBytes = 1u << 20;

void setWhy(std::string* why, std::string text) {
    if (why) *why = std::move(text);
}

int fail(std::string* why, int error, std::string text) {
    setWhy(why, std::move(text));
    return error;
}

// Root's alone: owned by uid 0 and writable by nobody else.
bool isRootsAlone(const struct stat& status) {
    return status.st_uid == 0 && (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

bool isBelow(const std::filesystem::path& path, const std::filesystem::path& root) {
    const std::string p = path.string(), r = root.string();
    if (r == "/") return p.size() > 1 && p[0] == '/';
    return p.size() > r.size() && p.compare(0, r.size(), r) == 0 && p[r.size()] == '/';
}

bool readAll(int fd, std::vector<uint8_t>& bytes, size_t limit) {
    uint8_t buffer[16384];
    for (;;) {
        ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return false;
        if (n == 0) return true;
        if (bytes.size() + static_cast<size_t>(n) > limit) {
            errno = EFBIG;
            return false;
        }
        bytes.insert(bytes.end(), buffer, buffer + n);
    }
}

bool writeAll(int fd, const std::vector<uint8_t>& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return false;
        done += static_cast<size_t>(n);
    }
    return true;
}

// Replaces `name` in `dirFd` with `bytes` so that a reader, or the next boot
// after a crash, finds either the old file or the new one whole.
int writeAtomically(int dirFd, const std::string& name, const std::vector<uint8_t>& bytes) {
    const std::string temp = "." + name + "." + Uuid::random().string() + ".tmp";
    UniqueFd fd(
        ::openat(dirFd, temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!fd) return errno;
    int error = 0;
    if (::fchmod(fd.get(), 0644) != 0 || !writeAll(fd.get(), bytes) || ::fsync(fd.get()) != 0)
        error = errno;
    fd.reset();
    if (error == 0 && ::renameat(dirFd, temp.c_str(), dirFd, name.c_str()) != 0) error = errno;
    if (error != 0) {
        ::unlinkat(dirFd, temp.c_str(), 0);
        return error;
    }
    return ::fsync(dirFd) == 0 ? 0 : errno;
}

std::optional<Sha256Digest> digestFromValue(const Value* value) {
    if (!value || !value->data() || value->data()->size() != Sha256Digest().size())
        return std::nullopt;
    Sha256Digest digest{};
    std::copy(value->data()->begin(), value->data()->end(), digest.begin());
    return digest;
}

std::optional<SignatureEntry> entryFromValue(const Value& dictionary, std::string* why) {
    const Value* path = dictionary.find(kPathKey);
    const Value* identifier = dictionary.find(kIdentifierKey);
    const Value* entitlements = dictionary.find(kEntitlementsKey);
    std::optional<Sha256Digest> digest = digestFromValue(dictionary.find(kDigestKey));
    if (!path || !path->string() || !std::filesystem::path(*path->string()).is_absolute()) {
        setWhy(why, "no absolute \"Path\"");
    } else if (!digest) {
        setWhy(why, "no 32-byte \"SHA256\"");
    } else if (!identifier || !identifier->string() || identifier->string()->empty()) {
        setWhy(why, "no \"Identifier\"");
    } else if (!entitlements || !entitlements->isDictionary()) {
        setWhy(why, "no \"Entitlements\" dictionary");
    } else {
        return SignatureEntry{*path->string(), *digest, *identifier->string(), *entitlements};
    }
    return std::nullopt;
}

Value entryToValue(const SignatureEntry& entry) {
    Value dictionary = Value::dictionary();
    dictionary.set(kPathKey, entry.executablePath.string());
    dictionary.set(kDigestKey, Value::Data(entry.digest.begin(), entry.digest.end()));
    dictionary.set(kIdentifierKey, entry.identifier);
    dictionary.set(kEntitlementsKey, entry.entitlements);
    return dictionary;
}

bool isEntryFileName(const char* name) {
    const size_t length = std::strlen(name), suffix = std::strlen(kEntrySuffix);
    return name[0] != '.' && length > suffix &&
           std::strcmp(name + length - suffix, kEntrySuffix) == 0;
}

}  // namespace

std::filesystem::path CodeSigningRegistry::defaultDirectory() {
    return DeviceRoot::resolve("/etc/berthd/signatures");
}

CodeSigningRegistry::CodeSigningRegistry() : CodeSigningRegistry(Options{}) {}

CodeSigningRegistry::CodeSigningRegistry(Options options)
    : directory_(options.directory.empty() ? defaultDirectory()
                                           : options.directory.lexically_normal()),
      digests_(options.digestCacheCapacity, options.racyWindow) {}

std::string CodeSigningRegistry::entryFileName(const std::filesystem::path& executablePath) {
    const std::string& text = executablePath.native();
    return hexString(sha256({reinterpret_cast<const uint8_t*>(text.data()), text.size()})) +
           kEntrySuffix;
}

// Opens the registry directory, walking from the trusted prefix (the device
// root, or "/" for a directory outside it) one component at a time without
// following links, and refusing any component that is not root's alone.
UniqueFd CodeSigningRegistry::openTrustedDirectory(bool create, std::string* why,
                                                   int* error) const {
    const std::filesystem::path& root = DeviceRoot::path();
    const std::filesystem::path prefix = isBelow(directory_, root) ? root : "/";
    std::filesystem::path walked = prefix;
    auto failed = [&](int errnum, std::string text) {
        *error = fail(why, errnum, std::move(text));
        return UniqueFd();
    };
    UniqueFd current(::open(prefix.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!current) return failed(errno, "cannot open " + prefix.string());
    for (const auto& component : directory_.lexically_relative(prefix)) {
        if (component == "." || component.empty()) continue;
        if (component == "..") return failed(EINVAL, "the registry path may not contain \"..\"");
        walked /= component;
        const int flags = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
        UniqueFd next(::openat(current.get(), component.c_str(), flags));
        if (!next && errno == ENOENT && create &&
            (::mkdirat(current.get(), component.c_str(), 0755) == 0 || errno == EEXIST))
            next.reset(::openat(current.get(), component.c_str(), flags));
        struct stat status {};
        if (!next || ::fstat(next.get(), &status) != 0) {
            const int errnum = errno;
            return failed(errnum, "cannot open " + walked.string() + ": " + strerror(errnum));
        }
        if (!isRootsAlone(status)) return failed(EPERM, walked.string() + " is not root's alone");
        current = std::move(next);
    }
    UniqueFd directory(::openat(current.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!directory) {
        const int errnum = errno;
        return failed(errnum, "cannot open " + walked.string() + ": " + strerror(errnum));
    }
    return directory;
}

std::optional<SignatureEntry> CodeSigningRegistry::readEntry(int dirFd, const std::string& fileName,
                                                             std::string* why,
                                                             bool* missing) const {
    UniqueFd fd(::openat(dirFd, fileName.c_str(),
                         O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    struct stat status {};
    if (!fd || ::fstat(fd.get(), &status) != 0) {
        const int error = errno;
        if (missing) *missing = error == ENOENT;
        setWhy(why, error == ELOOP ? "is a symbolic link" : strerror(error));
        return std::nullopt;
    }
    if (!S_ISREG(status.st_mode)) {
        setWhy(why, "is not a regular file");
        return std::nullopt;
    }
    if (!isRootsAlone(status)) {
        setWhy(why, "is not root's alone (owner or mode)");
        return std::nullopt;
    }
    std::vector<uint8_t> bytes;
    if (!readAll(fd.get(), bytes, kMaxEntryBytes)) {
        const int error = errno;
        setWhy(why, std::string("cannot be read: ") + strerror(error));
        return std::nullopt;
    }
    std::string parseError;
    std::optional<Value> dictionary = plist::parse(bytes, &parseError);
    if (!dictionary || !dictionary->isDictionary()) {
        setWhy(why, "is not a property-list dictionary" +
                        (parseError.empty() ? std::string() : ": " + parseError));
        return std::nullopt;
    }
    std::optional<SignatureEntry> entry = entryFromValue(*dictionary, why);
    if (entry && entryFileName(entry->executablePath) != fileName) {
        setWhy(why, "names another executable (" + entry->executablePath.string() + ")");
        return std::nullopt;
    }
    return entry;
}

int CodeSigningRegistry::sign(const std::filesystem::path& executablePath,
                              const std::string& identifier, const Value& entitlements,
                              std::string* why, SignatureEntry* written) {
    if (::geteuid() != 0) return fail(why, EPERM, "only root may sign executables");
    if (!executablePath.is_absolute())
        return fail(why, EINVAL, "the executable path must be absolute");
    if (identifier.empty()) return fail(why, EINVAL, "the identifier is empty");
    if (!entitlements.isDictionary())
        return fail(why, EINVAL, "the entitlements must be a dictionary");

    std::error_code resolveError;
    SignatureEntry entry{
        std::filesystem::canonical(executablePath, resolveError), {}, identifier, entitlements};
    if (resolveError)
        return fail(why, resolveError.value(),
                    executablePath.string() + ": " + resolveError.message());
    UniqueFd file = fs::openNoFollow(entry.executablePath, O_RDONLY | O_NONBLOCK | O_NOCTTY);
    struct stat status {};
    if (!file || ::fstat(file.get(), &status) != 0) {
        const int error = errno;
        return fail(why, error, entry.executablePath.string() + ": " + strerror(error));
    }
    if (!S_ISREG(status.st_mode))
        return fail(why, EINVAL, entry.executablePath.string() + " is not a regular file");
    std::optional<Sha256Digest> digest = sha256OfFile(file.get(), why);
    if (!digest) return EIO;
    entry.digest = *digest;

    std::string encodeError;
    std::optional<std::vector<uint8_t>> bytes =
        plist::serializeBinary(entryToValue(entry), &encodeError);
    if (!bytes) return fail(why, EINVAL, "the entitlements cannot be stored: " + encodeError);
    int error = 0;
    UniqueFd directory = openTrustedDirectory(true, why, &error);
    if (!directory) return error;
    error = writeAtomically(directory.get(), entryFileName(entry.executablePath), *bytes);
    if (error != 0)
        return fail(why, error, std::string("cannot write the entry: ") + strerror(error));
    if (written) *written = std::move(entry);
    return 0;
}

int CodeSigningRegistry::remove(const std::filesystem::path& executablePath, std::string* why) {
    if (::geteuid() != 0) return fail(why, EPERM, "only root may remove signatures");
    if (!executablePath.is_absolute())
        return fail(why, EINVAL, "the executable path must be absolute");
    std::error_code resolveError;
    std::filesystem::path resolved =
        std::filesystem::weakly_canonical(executablePath, resolveError);
    if (resolveError) resolved = executablePath.lexically_normal();
    int error = 0;
    UniqueFd directory = openTrustedDirectory(false, why, &error);
    if (!directory) return error;
    if (::unlinkat(directory.get(), entryFileName(resolved).c_str(), 0) != 0) {
        error = errno;
        return fail(why, error,
                    error == ENOENT ? "no signature for " + resolved.string() : strerror(error));
    }
    return ::fsync(directory.get()) == 0 ? 0 : errno;
}

CodeSigningRegistry::Listing CodeSigningRegistry::list() const {
    Listing listing;
    int error = 0;
    std::string why;
    UniqueFd directory = openTrustedDirectory(false, &why, &error);
    if (!directory) {
        if (error != ENOENT) listing.ignored.push_back({directory_.string(), why});
        return listing;
    }
    UniqueFd forReading(::fcntl(directory.get(), F_DUPFD_CLOEXEC, 0));
    std::unique_ptr<DIR, int (*)(DIR*)> stream(forReading ? ::fdopendir(forReading.get()) : nullptr,
                                               ::closedir);
    if (!stream) return listing;
    forReading.release();
    while (const struct dirent* item = ::readdir(stream.get())) {
        if (!isEntryFileName(item->d_name)) continue;
        if (std::optional<SignatureEntry> entry = readEntry(directory.get(), item->d_name, &why))
            listing.entries.push_back(std::move(*entry));
        else
            listing.ignored.push_back({item->d_name, why});
    }
    std::sort(listing.entries.begin(), listing.entries.end(),
              [](const auto& a, const auto& b) { return a.executablePath < b.executablePath; });
    return listing;
}

std::optional<SignatureEntry> CodeSigningRegistry::entryFor(
    const std::filesystem::path& executablePath, std::string* why) const {
    int error = 0;
    UniqueFd directory = openTrustedDirectory(false, why, &error);
    if (!directory) {
        if (error == ENOENT) setWhy(why, "no signature for " + executablePath.string());
        return std::nullopt;
    }
    const std::string fileName = entryFileName(executablePath);
    std::string reason;
    bool missing = false;
    std::optional<SignatureEntry> entry = readEntry(directory.get(), fileName, &reason, &missing);
    if (!entry) {
        setWhy(why, missing ? "no signature for " + executablePath.string()
                            : "the signature of " + executablePath.string() + " (" + fileName +
                                  ") is ignored: it " + reason);
    }
    return entry;
}

std::optional<PeerIdentity> CodeSigningRegistry::identify(pid_t pid, int pidfd, std::string* why) {
    std::optional<OpenedExecutable> executable = openProcessExecutable(pid, pidfd, why);
    if (!executable) return std::nullopt;
    std::optional<SignatureEntry> entry = entryFor(executable->path, why);
    if (!entry) return std::nullopt;
    std::optional<Sha256Digest> digest = digests_.digestOf(executable->fd.get(), why);
    if (!digest) return std::nullopt;
    if (*digest != entry->digest) {
        setWhy(why, "the contents of " + executable->path.string() + " do not match its signature");
        return std::nullopt;
    }
    return PeerIdentity{std::move(entry->identifier), std::move(entry->entitlements),
                        executable->id(), std::move(executable->path)};
}

std::optional<ExecutableId> CodeSigningRegistry::executableOf(pid_t pid, int pidfd,
                                                              std::string* why) {
    return runningExecutable(pid, pidfd, why);
}

}  // namespace berth

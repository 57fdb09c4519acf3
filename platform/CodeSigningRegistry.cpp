#include "platform/CodeSigningRegistry.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>

#include "platform/DeviceRoot.h"
#include "platform/LaunchCgroup.h"
#include "platform/PropertyList.h"
#include "platform/RootOwnedFiles.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

constexpr const char* kPathKey = "Path";
constexpr const char* kDigestKey = "SHA256";
constexpr const char* kUnitKey = "Unit";
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

std::optional<Sha256Digest> digestFromValue(const Value* value) {
    if (!value || !value->data() || value->data()->size() != Sha256Digest().size())
        return std::nullopt;
    Sha256Digest digest{};
    std::copy(value->data()->begin(), value->data()->end(), digest.begin());
    return digest;
}

std::optional<SignatureEntry> entryFromValue(const Value& dictionary, std::string* why) {
    const Value* path = dictionary.find(kPathKey);
    const Value* unit = dictionary.find(kUnitKey);
    const Value* identifier = dictionary.find(kIdentifierKey);
    const Value* entitlements = dictionary.find(kEntitlementsKey);
    std::optional<Sha256Digest> digest = digestFromValue(dictionary.find(kDigestKey));
    std::string unitError;
    if (unit && path) {
        setWhy(why, "names both a unit and a path");
    } else if (unit && (!unit->string() || !isServiceUnitName(*unit->string(), &unitError))) {
        setWhy(why, "no valid \"Unit\"");
    } else if (!unit && (!path || !path->string() ||
                         !std::filesystem::path(*path->string()).is_absolute())) {
        setWhy(why, "no absolute \"Path\"");
    } else if (!unit && !digest) {
        setWhy(why, "no 32-byte \"SHA256\"");
    } else if (!identifier || !identifier->string() || identifier->string()->empty()) {
        setWhy(why, "no \"Identifier\"");
    } else if (!entitlements || !entitlements->isDictionary()) {
        setWhy(why, "no \"Entitlements\" dictionary");
    } else if (unit) {
        return SignatureEntry{{}, {}, *unit->string(), *identifier->string(), *entitlements};
    } else {
        return SignatureEntry{*path->string(), *digest, {}, *identifier->string(), *entitlements};
    }
    return std::nullopt;
}

Value entryToValue(const SignatureEntry& entry) {
    Value dictionary = Value::dictionary();
    if (entry.isUnit()) {
        dictionary.set(kUnitKey, entry.unit);
    } else {
        dictionary.set(kPathKey, entry.executablePath.string());
        dictionary.set(kDigestKey, Value::Data(entry.digest.begin(), entry.digest.end()));
    }
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
      launches_(std::move(options.launchRecordDirectory)),
      launchCgroupParent_(options.launchCgroupParent.empty() ? LaunchCgroup::configuredParent()
                                                             : options.launchCgroupParent),
      racyWindow_(options.racyWindow),
      digests_(options.digestCacheCapacity, options.racyWindow) {}

std::string CodeSigningRegistry::entryFileName(const std::string& key) {
    return hexString(sha256({reinterpret_cast<const uint8_t*>(key.data()), key.size()})) +
           kEntrySuffix;
}

UniqueFd CodeSigningRegistry::openTrustedDirectory(bool create, std::string* why, int* error,
                                                   IdentityBasis* basis) const {
    std::string reason;
    UniqueFd directory = openRootOwnedDirectory(directory_, create, &reason, error, 0755, basis);
    if (!directory) setWhy(why, std::move(reason));
    return directory;
}

std::optional<SignatureEntry> CodeSigningRegistry::readEntry(int dirFd, const std::string& fileName,
                                                             std::string* why, bool* missing,
                                                             IdentityBasis* basis) const {
    std::string reason;
    struct stat status {};
    const std::optional<std::vector<uint8_t>> bytes =
        readRootOwnedFile(dirFd, fileName, kMaxEntryBytes, &reason, missing, &status);
    if (!bytes) {
        setWhy(why, std::move(reason));
        return std::nullopt;
    }
    if (basis) basis->record(directory_.lexically_normal() / fileName, status);
    std::string parseError;
    std::optional<Value> dictionary = plist::parse(*bytes, &parseError);
    if (!dictionary || !dictionary->isDictionary()) {
        setWhy(why, "is not a property-list dictionary" +
                        (parseError.empty() ? std::string() : ": " + parseError));
        return std::nullopt;
    }
    std::optional<SignatureEntry> entry = entryFromValue(*dictionary, why);
    if (entry && entryFileName(entry->key()) != fileName) {
        setWhy(why, "names another " + std::string(entry->isUnit() ? "unit" : "executable") + " (" +
                        entry->key() + ")");
        return std::nullopt;
    }
    return entry;
}

int CodeSigningRegistry::writeEntry(const SignatureEntry& entry, std::string* why) {
    std::string encodeError;
    std::optional<std::vector<uint8_t>> bytes =
        plist::serializeBinary(entryToValue(entry), &encodeError);
    if (!bytes) return fail(why, EINVAL, "the entitlements cannot be stored: " + encodeError);
    int error = 0;
    UniqueFd directory = openTrustedDirectory(true, why, &error);
    if (!directory) return error;
    error = replaceFileAtomically(directory.get(), entryFileName(entry.key()), *bytes);
    if (error != 0)
        return fail(why, error, std::string("cannot write the entry: ") + strerror(error));
    return 0;
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
        std::filesystem::canonical(executablePath, resolveError), {}, {}, identifier, entitlements};
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
    if (const int error = writeEntry(entry, why)) return error;
    if (written) *written = std::move(entry);
    return 0;
}

int CodeSigningRegistry::signUnit(const std::string& unit, const std::string& identifier,
                                  const Value& entitlements, std::string* why,
                                  SignatureEntry* written) {
    if (::geteuid() != 0) return fail(why, EPERM, "only root may sign units");
    std::string reason;
    if (!isServiceUnitName(unit, &reason)) return fail(why, EINVAL, reason);
    if (identifier.empty()) return fail(why, EINVAL, "the identifier is empty");
    if (!entitlements.isDictionary())
        return fail(why, EINVAL, "the entitlements must be a dictionary");
    SignatureEntry entry{{}, {}, unit, identifier, entitlements};
    if (const int error = writeEntry(entry, why)) return error;
    if (written) *written = std::move(entry);
    return 0;
}

int CodeSigningRegistry::removeByKey(const std::string& key, std::string* why) {
    int error = 0;
    UniqueFd directory = openTrustedDirectory(false, why, &error);
    if (!directory) return error;
    if (::unlinkat(directory.get(), entryFileName(key).c_str(), 0) != 0) {
        error = errno;
        return fail(why, error, error == ENOENT ? "no signature for " + key : strerror(error));
    }
    return ::fsync(directory.get()) == 0 ? 0 : errno;
}

int CodeSigningRegistry::remove(const std::filesystem::path& executablePath, std::string* why) {
    if (::geteuid() != 0) return fail(why, EPERM, "only root may remove signatures");
    if (!executablePath.is_absolute())
        return fail(why, EINVAL, "the executable path must be absolute");
    std::error_code resolveError;
    std::filesystem::path resolved =
        std::filesystem::weakly_canonical(executablePath, resolveError);
    if (resolveError) resolved = executablePath.lexically_normal();
    return removeByKey(resolved.string(), why);
}

int CodeSigningRegistry::removeUnit(const std::string& unit, std::string* why) {
    if (::geteuid() != 0) return fail(why, EPERM, "only root may remove signatures");
    std::string reason;
    if (!isServiceUnitName(unit, &reason)) return fail(why, EINVAL, reason);
    return removeByKey(unit, why);
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
              [](const auto& a, const auto& b) { return a.key() < b.key(); });
    return listing;
}

std::optional<SignatureEntry> CodeSigningRegistry::entryByKey(const std::string& key,
                                                              std::string* why,
                                                              IdentityBasis* basis) const {
    int error = 0;
    UniqueFd directory = openTrustedDirectory(false, why, &error, basis);
    if (!directory) {
        if (error == ENOENT) setWhy(why, "no signature for " + key);
        return std::nullopt;
    }
    const std::string fileName = entryFileName(key);
    std::string reason;
    bool missing = false;
    std::optional<SignatureEntry> entry =
        readEntry(directory.get(), fileName, &reason, &missing, basis);
    if (!entry) {
        setWhy(why, missing ? "no signature for " + key
                            : "the signature of " + key + " (" + fileName + ") is ignored: it " +
                                  reason);
    }
    return entry;
}

std::optional<SignatureEntry> CodeSigningRegistry::entryFor(
    const std::filesystem::path& executablePath, std::string* why, IdentityBasis* basis) const {
    std::optional<SignatureEntry> entry = entryByKey(executablePath.string(), why, basis);
    if (entry && entry->isUnit()) return std::nullopt;  // never: file names differ
    return entry;
}

std::optional<SignatureEntry> CodeSigningRegistry::entryForUnit(const std::string& unit,
                                                                std::string* why,
                                                                IdentityBasis* basis) const {
    std::string reason;
    if (!isServiceUnitName(unit, &reason)) {
        setWhy(why, reason);
        return std::nullopt;
    }
    std::optional<SignatureEntry> entry = entryByKey(unit, why, basis);
    if (entry && !entry->isUnit()) return std::nullopt;  // never: file names differ
    return entry;
}

std::optional<PeerIdentity> CodeSigningRegistry::identify(pid_t pid, int pidfd, std::string* why) {
    std::optional<OpenedExecutable> executable = openProcessExecutable(pid, pidfd, why);
    if (!executable) return std::nullopt;
    // The process, and the path its entry is looked up by, still name this
    // very file.
    IdentityBasis basis;
    basis.recordExecutable(executable->status,
                           UniqueFd(::fcntl(executable->fd.get(), F_DUPFD_CLOEXEC, 0)));
    basis.record(executable->path, executable->status);
    std::optional<SignatureEntry> entry = entryFor(executable->path, why, &basis);
    if (!entry) return std::nullopt;
    std::optional<Sha256Digest> digest = digests_.digestOf(executable->fd.get(), why);
    if (!digest) return std::nullopt;
    if (*digest != entry->digest) {
        setWhy(why, "the contents of " + executable->path.string() + " do not match its signature");
        return std::nullopt;
    }
    return PeerIdentity{std::move(entry->identifier), std::move(entry->entitlements),
                        executable->id(), std::move(executable->path), settled(std::move(basis))};
}

std::optional<ExecutableId> CodeSigningRegistry::executableOf(pid_t pid, int pidfd,
                                                              std::string* why) {
    return runningExecutable(pid, pidfd, why);
}

std::optional<PeerIdentity> CodeSigningRegistry::identifyLaunched(pid_t pid, int pidfd, uid_t uid,
                                                                  std::string* why) {
    std::string reason;
    const std::optional<std::string> cgroup = cgroupOfProcess(pid, pidfd, &reason);
    if (!cgroup) {
        setWhy(why, reason);
        return std::nullopt;
    }
    const CgroupOrigin origin = classifyCgroup(*cgroup, launchCgroupParent_);
    const char* notStarted = " was neither launched by berth-launch nor started as a bound unit";
    if (origin.kind == CgroupOrigin::Kind::Other) {
        setWhy(why,
               "pid " + std::to_string(pid) + " (control group /" + *cgroup + ")" + notStarted);
        return std::nullopt;
    }
    const std::optional<std::filesystem::path> mount = cgroup2Mount(&reason);
    if (!mount) {
        setWhy(why, reason);
        return std::nullopt;
    }
    IdentityBasis basis;
    basis.recordCgroup(*cgroup);
    std::optional<PeerIdentity> identity =
        origin.kind == CgroupOrigin::Kind::Launch
            ? identifyLaunch(*cgroup, origin, uid, *mount, &basis, why)
            : identifyUnit(*cgroup, origin, *mount, &basis, why);
    if (identity) identity->basis = settled(std::move(basis));
    return identity;
}

std::optional<std::filesystem::path> CodeSigningRegistry::cgroup2Mount(std::string* why) const {
    std::lock_guard lock(mountMutex_);
    if (!mount_) mount_ = LaunchCgroup::cgroup2Mount(why);
    return mount_;
}

// A launch is believed when its group can have been filled by root alone,
// its record is the one made for this very group, and the program the
// launcher checked is still signed as it was then.
std::optional<PeerIdentity> CodeSigningRegistry::identifyLaunch(
    const std::string& cgroup, const CgroupOrigin& origin, uid_t uid,
    const std::filesystem::path& mount, IdentityBasis* basis, std::string* why) const {
    std::string reason;
    const UniqueFd group = openTrustedCgroup(mount, cgroup, origin.trustedDepth, &reason, basis);
    struct stat status {};
    if (!group || ::fstat(group.get(), &status) != 0) {
        setWhy(why, reason.empty() ? "cannot open the control group /" + cgroup : reason);
        return std::nullopt;
    }
    const std::optional<LaunchRecord> record = launches_.read(origin.launch, &reason, basis);
    if (!record) {
        setWhy(why, reason);
        return std::nullopt;
    }
    // A group's path never changes (cgroup v2 groups cannot be renamed), and
    // its inode is never given to another group while the system runs.
    if (record->cgroupId != status.st_ino || record->identifier != origin.identifier) {
        setWhy(why, "the launch record of " + origin.launch + " was made for another group");
        return std::nullopt;
    }
    if (record->persona != uid) {
        setWhy(why, "the launch " + origin.launch + " runs as uid " +
                        std::to_string(record->persona) + ", not " + std::to_string(uid));
        return std::nullopt;
    }
    std::optional<SignatureEntry> entry = entryFor(record->executablePath, &reason, basis);
    if (!entry) {
        setWhy(why, reason);
        return std::nullopt;
    }
    if (entry->identifier != record->identifier || entry->digest != record->digest) {
        setWhy(why, record->executablePath.string() + " is no longer signed as it was launched");
        return std::nullopt;
    }
    return PeerIdentity{std::move(entry->identifier), std::move(entry->entitlements), {}, {}};
}

std::optional<PeerIdentity> CodeSigningRegistry::identifyUnit(const std::string& cgroup,
                                                              const CgroupOrigin& origin,
                                                              const std::filesystem::path& mount,
                                                              IdentityBasis* basis,
                                                              std::string* why) const {
    std::string reason;
    if (!openTrustedCgroup(mount, cgroup, origin.trustedDepth, &reason, basis)) {
        setWhy(why, reason);
        return std::nullopt;
    }
    std::optional<SignatureEntry> entry = entryForUnit(origin.unit, &reason, basis);
    if (!entry) {
        setWhy(why, reason);
        return std::nullopt;
    }
    return PeerIdentity{std::move(entry->identifier), std::move(entry->entitlements), {}, {}};
}

}  // namespace berth

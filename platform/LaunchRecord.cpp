#include "platform/LaunchRecord.h"

#include <dirent.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <limits>
#include <memory>

#include "platform/DeviceRoot.h"
#include "platform/ProcessCgroup.h"
#include "platform/PropertyList.h"
#include "platform/RootOwnedFiles.h"

namespace berth {

namespace {

constexpr const char* kIdentifierKey = "Identifier";
constexpr const char* kPathKey = "Path";
constexpr const char* kDigestKey = "SHA256";
constexpr const char* kPersonaKey = "Persona";
constexpr const char* kCgroupKey = "Cgroup";
constexpr const char* kCgroupIdKey = "CgroupID";
constexpr const char* kSuffix = ".plist";
constexpr size_t kMaxRecordBytes = 64 * 1024;

void setWhy(std::string* why, std::string text) {
    if (why) *why = std::move(text);
}

std::string fileNameOf(const std::string& launch) {
    return launch + kSuffix;
}

const std::string* stringAt(const Value& dictionary, const char* key) {
    const Value* value = dictionary.find(key);
    return value ? value->string() : nullptr;
}

std::optional<uint64_t> unsignedAt(const Value& dictionary, const char* key) {
    const Value* value = dictionary.find(key);
    if (!value || (value->kind() != Value::Kind::Int64 && value->kind() != Value::Kind::UInt64))
        return std::nullopt;
    if (value->kind() == Value::Kind::Int64 && *value->int64Value() < 0) return std::nullopt;
    return value->uint64Value();
}

Value toValue(const LaunchRecord& record) {
    Value dictionary = Value::dictionary();
    dictionary.set(kIdentifierKey, record.identifier);
    dictionary.set(kPathKey, record.executablePath.string());
    dictionary.set(kDigestKey, Value::Data(record.digest.begin(), record.digest.end()));
    dictionary.set(kPersonaKey, uint64_t{record.persona});
    dictionary.set(kCgroupKey, record.cgroup);
    dictionary.set(kCgroupIdKey, record.cgroupId);
    return dictionary;
}

std::optional<LaunchRecord> fromValue(const Value& dictionary, std::string* why) {
    const std::string* identifier = stringAt(dictionary, kIdentifierKey);
    const std::string* path = stringAt(dictionary, kPathKey);
    const std::string* cgroup = stringAt(dictionary, kCgroupKey);
    const Value* digest = dictionary.find(kDigestKey);
    const std::optional<uint64_t> persona = unsignedAt(dictionary, kPersonaKey);
    const std::optional<uint64_t> cgroupId = unsignedAt(dictionary, kCgroupIdKey);
    if (!identifier || identifier->empty() || !path ||
        !std::filesystem::path(*path).is_absolute() || !cgroup || cgroup->empty() || !digest ||
        !digest->data() || digest->data()->size() != Sha256Digest().size() || !persona ||
        *persona > std::numeric_limits<uid_t>::max() || !cgroupId) {
        setWhy(why, "is not a whole launch record");
        return std::nullopt;
    }
    LaunchRecord record{*identifier, *path, {}, static_cast<uid_t>(*persona), *cgroup, *cgroupId};
    std::copy(digest->data()->begin(), digest->data()->end(), record.digest.begin());
    return record;
}

}  // namespace

std::filesystem::path LaunchRecords::defaultDirectory() {
    return DeviceRoot::resolve("/run/berthd/launches");
}

LaunchRecords::LaunchRecords(std::filesystem::path directory)
    : directory_(directory.empty() ? defaultDirectory() : directory.lexically_normal()) {}

int LaunchRecords::write(const std::string& launch, const LaunchRecord& record,
                         std::string* why) const {
    if (::geteuid() != 0) {
        setWhy(why, "only root may record launches");
        return EPERM;
    }
    if (!isLaunchName(launch)) {
        setWhy(why, "\"" + launch + "\" is not a launch name");
        return EINVAL;
    }
    std::string encodeError;
    const std::optional<std::vector<uint8_t>> bytes =
        plist::serializeBinary(toValue(record), &encodeError);
    if (!bytes || !fromValue(toValue(record), nullptr)) {
        setWhy(why, "the launch record is incomplete" +
                        (encodeError.empty() ? std::string() : ": " + encodeError));
        return EINVAL;
    }
    int error = 0;
    std::string reason;
    const UniqueFd directory = openRootOwnedDirectory(directory_, true, &reason, &error);
    if (!directory) {
        setWhy(why, reason);
        return error;
    }
    error = replaceFileAtomically(directory.get(), fileNameOf(launch), *bytes);
    if (error != 0) setWhy(why, std::string("cannot write the launch record: ") + strerror(error));
    return error;
}

std::optional<LaunchRecord> LaunchRecords::read(const std::string& launch, std::string* why,
                                                IdentityBasis* basis) const {
    if (!isLaunchName(launch)) {
        setWhy(why, "\"" + launch + "\" is not a launch name");
        return std::nullopt;
    }
    int error = 0;
    std::string reason;
    const UniqueFd directory =
        openRootOwnedDirectory(directory_, false, &reason, &error, 0755, basis);
    if (!directory) {
        setWhy(why, error == ENOENT ? "no launch record for " + launch : reason);
        return std::nullopt;
    }
    bool missing = false;
    struct stat status {};
    const std::optional<std::vector<uint8_t>> bytes = readRootOwnedFile(
        directory.get(), fileNameOf(launch), kMaxRecordBytes, &reason, &missing, &status);
    if (bytes && basis) basis->record(directory_.lexically_normal() / fileNameOf(launch), status);
    std::optional<Value> dictionary;
    if (bytes) dictionary = plist::parse(*bytes, &reason);
    std::optional<LaunchRecord> record;
    if (dictionary && dictionary->isDictionary())
        record = fromValue(*dictionary, &reason);
    else if (dictionary)
        reason = "is not a dictionary";
    if (!record)
        setWhy(why, missing ? "no launch record for " + launch
                            : "the launch record of " + launch + " is ignored: it " + reason);
    return record;
}

int LaunchRecords::remove(const std::string& launch) const {
    if (!isLaunchName(launch)) return EINVAL;
    int error = 0;
    std::string why;
    const UniqueFd directory = openRootOwnedDirectory(directory_, false, &why, &error);
    if (!directory) return error;
    if (::unlinkat(directory.get(), fileNameOf(launch).c_str(), 0) != 0) return errno;
    return 0;
}

std::vector<std::string> LaunchRecords::launches() const {
    std::vector<std::string> names;
    int error = 0;
    std::string why;
    UniqueFd directory = openRootOwnedDirectory(directory_, false, &why, &error);
    if (!directory) return names;
    std::unique_ptr<DIR, int (*)(DIR*)> stream(::fdopendir(directory.get()), ::closedir);
    if (!stream) return names;
    directory.release();
    const size_t suffix = std::strlen(kSuffix);
    while (const struct dirent* item = ::readdir(stream.get())) {
        const std::string_view name = item->d_name;
        if (name.size() <= suffix || name.substr(name.size() - suffix) != kSuffix) continue;
        if (isLaunchName(name.substr(0, name.size() - suffix)))
            names.emplace_back(name.substr(0, name.size() - suffix));
    }
    return names;
}

}  // namespace berth

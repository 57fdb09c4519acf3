#include "BTHMetadata.h"

#include <cerrno>
#include <cstring>

#include "BTHFaultInjection.h"
#include "BTHPropertyListFile.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

constexpr const char* kReadFunction =
    "+[BTHMetadata readAndValidateMetadataAtUrl:forUser:checkClassPath:error:]";

// What a file says once its keys have passed their checks.
struct StoredFields {
    std::string identifier;
    Uuid uuid;
    uint64_t containerClass = 0;
    std::optional<Value> info;
    std::optional<std::string> userManagedAssetsDirName;
};

// A key's value as the messages show it: the value, or "(null)" when absent.
FormatArg shown(const Value* value) {
    return value ? FormatArg(*value) : FormatArg(nullptr);
}

// A number in this file is an integer or a real; a boolean is not a number.
bool isNumber(const Value* value) {
    return value && value->isNumber();
}

BTHErrorRef checkIdentity(const Value& dict, const std::filesystem::path& url, StoredFields* out) {
    BTH_FUNCTION(kReadFunction);
    const Value* identifier = dict.find(kBTHMetadataIdentifierKey);
    if (!identifier || !identifier->isString())
        return BTHMakeError(BTHErrorMetadataInvalid, nullptr,
                            "Invalid metadata Identifier: %@ at %@", shown(identifier), url);
    const Value* uuidString = dict.find(kBTHMetadataUUIDKey);
    if (!uuidString || !uuidString->isString())
        return BTHMakeError(BTHErrorMetadataInvalid, nullptr,
                            "Invalid metadata UUID String: %@ at %@", shown(uuidString), url);
    std::optional<Uuid> uuid = Uuid::parse(*uuidString->string());
    if (!uuid)
        return BTHMakeError(BTHErrorMetadataInvalid, nullptr, "Invalid metadata UUID: %@ at %@",
                            uuid, url);
    out->identifier = *identifier->string();
    out->uuid = *uuid;
    return nullptr;
}

BTHErrorRef checkClass(const Value& dict, const std::filesystem::path& url, StoredFields* out) {
    BTH_FUNCTION(kReadFunction);
    const Value* containerClass = dict.find(kBTHMetadataContentClassKey);
    if (!isNumber(containerClass))
        return BTHMakeError(BTHErrorMetadataInvalid, nullptr, "Invalid metadata Class: %@ at %@",
                            shown(containerClass), url);
    const uint64_t value = *containerClass->uint64Value();
    if (!BTHContainerClassIsValid(value))
        return BTHMakeError(BTHErrorMetadataInvalid, nullptr,
                            "Invalid metadata Content Class: %ld at %@", value, url);
    out->containerClass = value;
    return nullptr;
}

// A stored user matches only when it is a number equal to `expectedUser`; a
// value beyond 32 bits is not read modulo 2^32.
//
// Files written before the user key existed carry none. Such a file belongs
// to whoever reads it: the original mobile user 501 for a per-user class, 33
// for a bundle class, and any other reader alike (supplying 501 or 33 first
// and comparing it with the reader could never fail). Nothing is written back.
BTHErrorRef checkUser(const Value& dict, const std::filesystem::path& url, uid_t expectedUser,
                      const StoredFields& fields) {
    BTH_FUNCTION(kReadFunction);
    const Value* stored = dict.find(kBTHMetadataPersonaKey);
    if (!stored || (isNumber(stored) && *stored->uint64Value() == expectedUser)) return nullptr;
    return BTHMakeError(BTHErrorMetadataInvalid, nullptr,
                        "Incorrect UserId: %@, expecting: %u for %@ at %@", *stored, expectedUser,
                        fields.identifier, url);
}

BTHErrorRef checkOptionalKeys(const Value& dict, const std::filesystem::path& url,
                              StoredFields* out) {
    BTH_FUNCTION(kReadFunction);
    const Value* info = dict.find(kBTHMetadataInfoKey);
    if (info && !info->isDictionary())
        return BTHMakeError(BTHErrorMetadataInvalid, nullptr, "Invalid metadata Info: %@ at %@",
                            *info, url);
    const Value* name = dict.find(kBTHMetadataUserManagedAssetsDirNameKey);
    if (name && !name->isString())
        return BTHMakeError(BTHErrorMetadataInvalid, nullptr,
                            "Invalid metadata User Managed Dir Name String: %@ at %@", *name, url);
    if (info) out->info = *info;
    if (name) out->userManagedAssetsDirName = *name->string();
    return nullptr;
}

std::filesystem::path withoutTrailingSlashes(const std::filesystem::path& path) {
    std::string text = path.string();
    while (text.size() > 1 && text.back() == '/') text.pop_back();
    return text;
}

// A container sits in its class directory: <base>/<class name>/<UUID>. The
// comparison is of path strings; nothing is resolved on disk.
BTHErrorRef checkClassDirectory(const std::filesystem::path& url, uint64_t containerClass) {
    BTH_FUNCTION(kReadFunction);
    const std::filesystem::path classDirectory = withoutTrailingSlashes(url).parent_path();
    const std::filesystem::path expected = classDirectory.parent_path().parent_path() /
                                           std::string(BTHContainerClassName(containerClass));
    if (expected.string() == classDirectory.string()) return nullptr;
    return BTHMakeError(BTHErrorMetadataInvalid, nullptr,
                        "Invalid metadata-URLs should match: %@ : %@", url, expected);
}

}  // namespace

BTHMetadata::BTHMetadata(uid_t uid, const Uuid& uuid, uint64_t containerClass,
                         std::string identifier, std::optional<Value> info,
                         std::filesystem::path url,
                         std::optional<std::string> userManagedAssetsDirName)
    : uuid_(uuid),
      containerClass_(containerClass),
      uid_(uid),
      identifier_(std::move(identifier)),
      url_(std::move(url)),
      userManagedAssetsDirName_(std::move(userManagedAssetsDirName)),
      info_(std::move(info)) {}

std::filesystem::path BTHMetadata::metadataFileURL(const std::filesystem::path& containerURL) {
    return containerURL / kBTHMetadataFileName;
}

bool BTHMetadata::writeMetadataToDisk(BTHErrorRef* error) const {
    return write(kBTHStateFileWriteOptions, error);
}

bool BTHMetadata::writeStagedMetadataToDisk(BTHErrorRef* error) const {
    return write(kBTHStateFileWriteOptions | BTHWriteSyncLater, error);
}

bool BTHMetadata::write(uint32_t options, BTHErrorRef* error) const {
    BTH_FUNCTION("-[BTHMetadata writeMetadataToDiskWithError:]");
    Value dict = Value::dictionary();
    if (info_) dict.set(kBTHMetadataInfoKey, *info_);
    dict.set(kBTHMetadataContentClassKey, Value(containerClass_));
    dict.set(kBTHMetadataPersonaKey, Value(static_cast<uint32_t>(uid_)));
    dict.set(kBTHMetadataIdentifierKey, Value(identifier_));
    dict.set(kBTHMetadataUUIDKey, Value(uuid_.string()));
    if (userManagedAssetsDirName_)
        dict.set(kBTHMetadataUserManagedAssetsDirNameKey, Value(*userManagedAssetsDirName_));

    BTHErrorRef writeError;
    if (BTHFaultActive("metadata.write")) {
        writeError = BTHMakePOSIXError(EIO, "%s", strerror(EIO));
    } else if (BTH_writeToURL(dict, metadataFileURL(url_), options, &writeError)) {
        return true;
    }
    BTHSetError(error, BTHMakeError(BTHErrorWriteFailed, writeError,
                                    "Failed to write metadata dictionary to URL %@", url_));
    return false;
}

std::shared_ptr<BTHMetadata> BTHMetadata::readAndValidateMetadataAtUrl(
    const std::filesystem::path& containerURL, uid_t expectedUser, bool checkClassPath,
    BTHErrorRef* error) {
    BTH_FUNCTION(kReadFunction);
    BTHErrorRef readError;
    std::optional<Value> dict = BTH_dictionaryWithContentsOfURL(metadataFileURL(containerURL),
                                                                BTHReadImmutable, &readError);
    if (!dict) {
        BTHSetError(error, BTHMakeError(BTHErrorMetadataReadFailed, readError,
                                        "Failed to read metadata at URL %@", containerURL));
        return nullptr;
    }

    StoredFields fields;
    BTHErrorRef failure = checkIdentity(*dict, containerURL, &fields);
    if (!failure) failure = checkClass(*dict, containerURL, &fields);
    if (!failure) failure = checkUser(*dict, containerURL, expectedUser, fields);
    if (!failure) failure = checkOptionalKeys(*dict, containerURL, &fields);
    if (!failure && checkClassPath)
        failure = checkClassDirectory(containerURL, fields.containerClass);
    if (failure) {
        BTHSetError(error, std::move(failure));
        return nullptr;
    }
    return std::make_shared<BTHMetadata>(expectedUser, fields.uuid, fields.containerClass,
                                         std::move(fields.identifier), std::move(fields.info),
                                         containerURL, std::move(fields.userManagedAssetsDirName));
}

std::string BTHMetadata::description() const {
    return format(
        "<BTHMetadata uid: %u, class: %llu (%s), identifier: %@, uuid: %@, url: %@, "
        "transient: %d, existed: %d, info: %zu keys, userManagedAssetsDirName: %@>",
        uid_, containerClass_, std::string(BTHContainerClassName(containerClass_)), identifier_,
        uuid_, url_, transient_, existed_, info_ ? info_->size() : size_t{0},
        userManagedAssetsDirName_);
}

}  // namespace berth

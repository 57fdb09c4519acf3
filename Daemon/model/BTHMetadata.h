// BTHMetadata: the record of one container (whose it is, of which class, for
// which user) and the reader and writer of the file every container directory
// holds, ".sys.kelp.berth.metadata.plist".
//
// The daemon never trusts a directory's name or place alone: whenever it
// finds a container on disk it reads and validates this file, and it writes
// the file whenever it creates a container or changes its identity or info.
//
// The file is a binary property list whose top level is a dictionary:
//
//   "BTHMetadataIdentifier"                string, always
//   "BTHMetadataUUID"                      upper-case UUID string, always
//   "BTHMetadataContentClass"              unsigned 64-bit integer, always
//   "BTHMetadataPersona"                   unsigned 32-bit integer (the uid), always
//   "BTHMetadataInfo"                      dictionary, only when info is set
//   "BTHMetadataUserManagedAssetsDirName"  string, only when set
//
// Other keys are ignored when reading and never written. Files of the XML
// property-list format are read as well; the daemon always writes binary.
//
// The file lives in a directory the container's app owns, so its content is
// untrusted: the reader opens it with no symbolic link followed anywhere in
// its path below the device root, refuses anything but a regular file, and
// validates every key before believing any of it.
//
// A record is a plain value; it is not shared between threads while being
// changed. The file is replaced atomically, so a concurrent reader sees the
// old or the new file, never a partial one.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>

#include "BTHError.h"
#include "core/BTHContainerClass.h"
#include "core/Uuid.h"
#include "core/Value.h"

namespace berth {

inline constexpr const char* kBTHMetadataIdentifierKey = "BTHMetadataIdentifier";
inline constexpr const char* kBTHMetadataUUIDKey = "BTHMetadataUUID";
inline constexpr const char* kBTHMetadataContentClassKey = "BTHMetadataContentClass";
inline constexpr const char* kBTHMetadataPersonaKey = "BTHMetadataPersona";
inline constexpr const char* kBTHMetadataInfoKey = "BTHMetadataInfo";
inline constexpr const char* kBTHMetadataUserManagedAssetsDirNameKey =
    "BTHMetadataUserManagedAssetsDirName";

class BTHMetadata {
  public:
    // `info`, when given, is a dictionary of the container's info values.
    // `transient` and `existed` start false.
    BTHMetadata(uid_t uid, const Uuid& uuid, uint64_t containerClass, std::string identifier,
                std::optional<Value> info, std::filesystem::path url,
                std::optional<std::string> userManagedAssetsDirName);

    // The user the container belongs to: 33 for bundle containers, 499 for
    // system ones, else the user's own id.
    uid_t uid() const { return uid_; }
    void setUid(uid_t uid) { uid_ = uid; }
    void setUserId(uid_t uid) { uid_ = uid; }

    // The container's internal UUID, by which requests address it (not the
    // name of its directory).
    const Uuid& uuid() const { return uuid_; }
    void setUuid(const Uuid& uuid) { uuid_ = uuid; }

    uint64_t containerClass() const { return containerClass_; }
    void setContainerClass(uint64_t containerClass) { containerClass_ = containerClass; }

    const std::string& identifier() const { return identifier_; }
    void setIdentifier(std::string identifier) { identifier_ = std::move(identifier); }

    // The container's info values: absent, or a dictionary.
    const std::optional<Value>& info() const { return info_; }
    void setInfo(std::optional<Value> info) { info_ = std::move(info); }

    // The container directory.
    const std::filesystem::path& url() const { return url_; }
    void setUrl(std::filesystem::path url) { url_ = std::move(url); }

    const std::optional<std::string>& userManagedAssetsDirName() const {
        return userManagedAssetsDirName_;
    }
    void setUserManagedAssetsDirName(std::optional<std::string> name) {
        userManagedAssetsDirName_ = std::move(name);
    }

    // The container lives in a transient class directory. Not stored.
    bool transient() const { return transient_; }
    void setTransient(bool transient) { transient_ = transient; }

    // The operation that returned the record found the container rather than
    // made it. Not stored.
    bool existed() const { return existed_; }
    void setExisted(bool existed) { existed_ = existed; }

    // The metadata file of the container at `containerURL`.
    static std::filesystem::path metadataFileURL(const std::filesystem::path& containerURL);

    // Replaces the container's metadata file, atomically and durably, with
    // this record. On failure returns false with error 34
    // (BTHErrorWriteFailed, logged) whose underlying error is the writer's;
    // the old file, if any, is then left as it was and no partial file is.
    bool writeMetadataToDisk(BTHErrorRef* error) const;
    // The same for a container still being built in staging: atomic, but
    // not yet durable; the builder syncs the file and the tree before the
    // container is published.
    bool writeStagedMetadataToDisk(BTHErrorRef* error) const;

    // Reads and validates the metadata file of the container at
    // `containerURL` for `expectedUser`. Returns a new record whose uid is
    // `expectedUser` and whose url is `containerURL` (transient and existed
    // false), or null with a logged error:
    //   12 (BTHErrorMetadataReadFailed) the file cannot be read without
    //      following a link, is not a property list, or is not a dictionary;
    //   29 (BTHErrorMetadataInvalid) a key has the wrong type or value, the
    //      stored user is not `expectedUser`, or (with `checkClassPath`) the
    //      container does not sit in the directory of its stored class.
    // The checks run in a fixed order and the first failing one is reported.
    // A file without a stored user is accepted for any user; it is never
    // rewritten by the read.
    static std::shared_ptr<BTHMetadata> readAndValidateMetadataAtUrl(
        const std::filesystem::path& containerURL, uid_t expectedUser, bool checkClassPath,
        BTHErrorRef* error);

    // One line for log messages.
    std::string description() const;

    friend bool operator==(const BTHMetadata&, const BTHMetadata&) = default;

  private:
    bool write(uint32_t options, BTHErrorRef* error) const;

    Uuid uuid_;
    uint64_t containerClass_;
    uid_t uid_;
    bool transient_ = false;
    bool existed_ = false;
    std::string identifier_;
    std::filesystem::path url_;
    std::optional<std::string> userManagedAssetsDirName_;
    std::optional<Value> info_;
};

}  // namespace berth

#include "BTHProcessContainers.h"

#include <cerrno>
#include <filesystem>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "BTHClientConnection.h"
#include "BTHCodeSigningMapping.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"
#include "core/Value.h"
#include "packbuff/packbuff.h"
#include "platform/DeviceRoot.h"
#include "platform/UpcallTransport.h"

namespace berth {

namespace {

constexpr size_t kReplyBlockSize = 4096;

struct PackbuffDeleter {
    void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};
using Packbuff = std::unique_ptr<sb_packbuff, PackbuffDeleter>;

// What a request asks for. A later item of a single-valued type replaces an
// earlier one.
struct ProcessRequest {
    std::optional<std::string> signingIdentifier;
    std::optional<std::string> containerIdentifier;
    std::optional<std::string> applicationIdentifier;
    uint32_t persona = 0;
    std::vector<std::string> appGroups;
    uint32_t containerType = kBTHSandboxContainerTypeApplication;
    std::optional<std::string> systemContainerIdentifier;
    std::vector<std::string> systemGroups;
};

// The answers of a request whose lookups all succeeded.
struct ProcessAnswers {
    std::optional<std::filesystem::path> home;
    std::optional<std::filesystem::path> dataContainer;
    std::optional<std::filesystem::path> tempDirectory;
    std::vector<std::pair<std::string, std::filesystem::path>> appGroups;
    std::optional<std::filesystem::path> systemContainer;
    std::vector<std::pair<std::string, std::filesystem::path>> systemGroups;
};

const char* stringItemName(uint16_t valueType) {
    switch (valueType) {
        case BT_KERN_REQUEST_CODE_SIGNATURE_ID:
            return "BT_KERN_REQUEST_CODE_SIGNATURE_ID";
        case BT_KERN_REQUEST_APPLICATION_ID:
            return "BT_KERN_REQUEST_APPLICATION_ID";
        case BT_KERN_REQUEST_APP_GROUP_ID:
            return "BT_KERN_REQUEST_APP_GROUP_ID";
        case BT_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
            return "BT_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID";
        default:
            return "BT_KERN_REQUEST_CONTAINER_ID";  // 1 and 6 alike
    }
}

// Reads one string item as the C string it holds. 0 or the pack error.
int unpackString(sb_packbuff* pb, uint16_t valueType, std::string* out) {
    BTH_FUNCTION("server_get_process_containers");
    int error = 0;
    const char* value = sb_packbuff_unpack_string(pb, nullptr, &error);
    if (!value || error != 0) {
        BTHLogError("failed: to unpack string for %s. error: %d\n", stringItemName(valueType),
                    error);
        return error ? error : EINVAL;
    }
    *out = value;
    return 0;
}

int unpackUint32(sb_packbuff* pb, const char* name, uint32_t* out) {
    BTH_FUNCTION("server_get_process_containers");
    int error = 0;
    const uint32_t value = sb_packbuff_unpack_uint32(pb, &error);
    if (error != 0) {
        BTHLogError("failed: to unpack uint32 for %s. error: %d\n", name, error);
        return error;
    }
    *out = value;
    return 0;
}

// Reads every item of the request. 0, or the routine's return code.
int32_t readRequest(sb_packbuff* pb, ProcessRequest* request) {
    BTH_FUNCTION("server_get_process_containers");
    uint16_t valueType = 0;
    while (sb_packbuff_get_item_value_type(pb, &valueType)) {
        std::string text;
        int failed = 0;
        switch (valueType) {
            case BT_KERN_REQUEST_CODE_SIGNATURE_ID:
            case BT_KERN_REQUEST_CONTAINER_ID:
            case BT_KERN_REQUEST_APPLICATION_ID:
            case BT_KERN_REQUEST_APP_GROUP_ID:
            case BT_KERN_REQUEST_SYSTEM_CONTAINER_ID:
            case BT_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
                failed = unpackString(pb, valueType, &text);
                break;
            case BT_KERN_REQUEST_PERSONA_ID:
                failed = unpackUint32(pb, "BT_KERN_REQUEST_PERSONA_ID", &request->persona);
                break;
            case BT_KERN_REQUEST_CONTAINER_TYPE:
                failed =
                    unpackUint32(pb, "BT_KERN_REQUEST_CONTAINER_TYPE", &request->containerType);
                break;
            default:
                BTHLogError("unexpected value: %u\n", uint32_t{valueType});
                return kBTHUpcallUnknownItem;
        }
        if (failed) return kBTHUpcallBadItemOrSender;
        switch (valueType) {
            case BT_KERN_REQUEST_CODE_SIGNATURE_ID:
                request->signingIdentifier = text;
                break;
            case BT_KERN_REQUEST_CONTAINER_ID:
                request->containerIdentifier = text;
                break;
            case BT_KERN_REQUEST_APPLICATION_ID:
                request->applicationIdentifier = text;
                break;
            case BT_KERN_REQUEST_APP_GROUP_ID:
                request->appGroups.push_back(text);
                break;
            case BT_KERN_REQUEST_SYSTEM_CONTAINER_ID:
                request->systemContainerIdentifier = text;
                break;
            case BT_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
                request->systemGroups.push_back(text);
                break;
            default:
                break;
        }
    }
    return 0;
}

// The container of (user, identifier, class), found or created with its
// identifier locks taken; its path, or none with the code stored.
std::optional<std::filesystem::path> lookUp(uid_t user, const std::string& identifier,
                                            uint64_t containerClass, uint64_t* code) {
    BTHMetadataRef record =
        BTHClientConnection::sharedClientConnection()->createOrLookupContainerForUser(
            user, identifier, true, containerClass, false, true, code);
    if (!record) return std::nullopt;
    return record->url();
}

// The user's home directory; none for a user the device does not know.
std::optional<std::filesystem::path> homeDirectory(uid_t user) {
    if (user == kBTHRootUserId) return DeviceRoot::resolve("/private/var/root");
    auto configuration =
        BTHGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(user);
    if (!configuration || !configuration->userHomeDirectory()) return std::nullopt;
    return *configuration->userHomeDirectory();
}

Value pathsDescription(const std::vector<std::pair<std::string, std::filesystem::path>>& paths) {
    Value list = Value::array();
    for (const auto& [identifier, path] : paths) list.push(Value(path.string()));
    return list;
}

// Finds or creates every container the request names; the answers when all
// of them were had, else none (each failure logged).
std::optional<ProcessAnswers> lookUpContainers(const ProcessRequest& request) {
    BTH_FUNCTION("server_get_process_containers");
    bool success = true;
    ProcessAnswers answers;
    const uid_t user = request.persona;
    uint64_t code = 0;
    std::optional<std::string> dataIdentifier =
        request.containerIdentifier ? request.containerIdentifier : request.signingIdentifier;
    if (dataIdentifier) {
        BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
        const uint64_t stored =
            mapping ? mapping->dataContainerTypeForIdentifier(*dataIdentifier) : 0;
        const uint64_t containerClass =
            BTHUpcallDataContainerClass(request.containerType, stored, *dataIdentifier);
        answers.dataContainer = lookUp(user, *dataIdentifier, containerClass, &code);
        if (!answers.dataContainer) {
            BTHLogError("createOrLookupContainerForUser: Failed with error: %llu", code);
            success = false;
        }
    }
    if (request.systemContainerIdentifier) {
        answers.systemContainer = lookUp(kBTHSystemUserId, *request.systemContainerIdentifier,
                                         BTHContainerClassDataSystem, &code);
        if (!answers.systemContainer) {
            BTHLogError("createOrLookupContainerForUser:(system container) Failed with error: %llu",
                        code);
            success = false;
        }
    }
    for (const std::string& group : request.appGroups) {
        if (auto path = lookUp(user, group, BTHContainerClassSharedAppGroup, &code)) {
            answers.appGroups.emplace_back(group, std::move(*path));
        } else {
            BTHLogError("createOrLookupGroupContainersForUser: Failed with error: %llu", code);
            success = false;
        }
    }
    for (const std::string& group : request.systemGroups) {
        if (auto path =
                lookUp(kBTHSystemUserId, group, BTHContainerClassSharedSystemGroup, &code)) {
            answers.systemGroups.emplace_back(group, std::move(*path));
        } else {
            BTHLogError(
                "createOrLookupContainerForUser:(system group container) Failed with error: %llu",
                code);
            success = false;
        }
    }
    if (!success) return std::nullopt;

    if (answers.dataContainer) answers.tempDirectory = *answers.dataContainer / "tmp";
    answers.home = homeDirectory(user);
    BTHLogDebug("UPCALL-Containers for %@(%u):", dataIdentifier.value_or("(null)"), user);
    BTHLogDebug("dataContainerURL: %@",
                answers.dataContainer ? answers.dataContainer->string() : "(null)");
    BTHLogDebug("tempContainerURL: %@",
                answers.tempDirectory ? answers.tempDirectory->string() : "(null)");
    BTHLogDebug("homeDirURL: %@", answers.home ? answers.home->string() : "(null)");
    BTHLogDebug("groupURLs: %@", pathsDescription(answers.appGroups));
    BTHLogDebug("systemContainerURL: %@",
                answers.systemContainer ? answers.systemContainer->string() : "(null)");
    BTHLogDebug("systemGroupURLs: %@", pathsDescription(answers.systemGroups));
    return answers;
}

bool packPath(sb_packbuff* pb, uint16_t type, const std::optional<std::filesystem::path>& path) {
    BTH_FUNCTION("server_get_process_containers");
    if (!path) return true;
    const std::string& text = path->native();
    if (int error = sb_packbuff_pack_string(pb, type, text.c_str(), text.size())) {
        BTHLogError("sb_packbuff_pack_string() fails: %d; type: %u, path: %s\n", error,
                    uint32_t{type}, text.c_str());
        return false;
    }
    return true;
}

bool packPairs(sb_packbuff* pb, uint16_t keyType, uint16_t valueType,
               const std::vector<std::pair<std::string, std::filesystem::path>>& pairs,
               bool systemGroups) {
    BTH_FUNCTION("server_get_process_containers");
    for (const auto& [identifier, path] : pairs) {
        const int error = sb_packbuff_pack_key_with_string_value(pb, keyType, identifier.c_str(),
                                                                 valueType, path.c_str());
        if (error == 0) continue;
        if (systemGroups)
            BTHLogError(
                "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, system group "
                "container: %s\n",
                error, identifier.c_str(), path.c_str());
        else
            BTHLogError(
                "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, group "
                "container: %s\n",
                error, identifier.c_str(), path.c_str());
        return false;
    }
    return true;
}

// Writes the answers in the reply's order, stopping at the first failure,
// then the success item. False when even the success item failed.
void packAnswers(sb_packbuff* pb, const std::optional<ProcessAnswers>& answers) {
    BTH_FUNCTION("server_get_process_containers");
    bool success = answers.has_value();
    if (success) {
        success = packPath(pb, BT_KERN_REPLY_HOME_DIR_PATH, answers->home) &&
                  packPath(pb, BT_KERN_REPLY_DATA_CONTAINER_PATH, answers->dataContainer) &&
                  packPath(pb, BT_KERN_REPLY_TEMP_DIR_PATH, answers->tempDirectory) &&
                  packPairs(pb, BT_KERN_REPLY_APP_GROUP_ID, BT_KERN_REPLY_APP_GROUP_PATH,
                            answers->appGroups, false) &&
                  packPath(pb, BT_KERN_REPLY_SYSTEM_CONTAINER_PATH, answers->systemContainer) &&
                  packPairs(pb, BT_KERN_REPLY_SYSTEM_GROUP_ID, BT_KERN_REPLY_SYSTEM_GROUP_PATH,
                            answers->systemGroups, true);
    }
    const uint32_t value = success ? 1 : 0;
    if (int error = sb_packbuff_pack_uint32(pb, BT_KERN_REPLY_SUCCESS, value))
        BTHLogError("sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u\n", error,
                    uint32_t{BT_KERN_REPLY_SUCCESS}, value);
}

}  // namespace

uint64_t BTHUpcallDataContainerClass(uint32_t containerType, uint64_t storedClass,
                                     const std::string& identifier) {
    BTH_FUNCTION("server_get_process_containers");
    switch (storedClass) {
        case 2:
        case 4:
        case 6:
        case 7:
        case 9:
        case 10:
        case 11:
            if (containerType == kBTHSandboxContainerTypePlugin && storedClass != 4) {
                BTHLogNotice("SB Type: %u, LD Type: %llu.  Declaring this a plugin", containerType,
                             storedClass);
                return BTHContainerClassDataSprocketPlugin;
            }
            if (containerType == kBTHSandboxContainerTypeApplication && storedClass != 2)
                BTHLogNotice("SB type is app, but LD type is %llu", storedClass);
            return storedClass;
        default: {
            BTHLogError("Invalid data container class for %@: %llu", identifier, storedClass);
            const uint64_t fallback = containerType == kBTHSandboxContainerTypePlugin
                                          ? BTHContainerClassDataSprocketPlugin
                                          : BTHContainerClassDataApplication;
            BTHLogNotice("SB Type: %u, falling back to class: %llu", containerType, fallback);
            return fallback;
        }
    }
}

int32_t server_get_process_containers(const uint8_t* requestData, uint32_t requestSize,
                                      UniqueFd* replyData, uint32_t* replySize) {
    BTH_FUNCTION("server_get_process_containers");
    *replySize = 0;
    BTHLogDebug("request size: %u (%p)", requestSize, static_cast<const void*>(requestData));
    // The request is only read; the record never writes through its pointer.
    Packbuff request(sb_packbuff_init_with_buffer(const_cast<uint8_t*>(requestData), requestSize,
                                                  true, SB_PACKBUFF_DEALLOC_NONE));
    if (!request) {
        BTHLogError("sb_packbuff_init() of request data fails");
        return kBTHUpcallOutOfMemory;
    }
    BTHLogDebug("request packbuff byte address:%p", sb_packbuff_get_bytes(request.get()));
    ProcessRequest parsed;
    if (const int32_t code = readRequest(request.get(), &parsed)) return code;
    request.reset();

    Packbuff reply(sb_packbuff_new(kReplyBlockSize));
    if (!reply) return kBTHUpcallOutOfMemory;
    const std::shared_ptr<BTHClientConnection>& daemon =
        BTHClientConnection::sharedClientConnection();
    daemon->setAllowOtherIdLookup(true);
    daemon->setAllowGroupIdLookup(true);
    packAnswers(reply.get(), lookUpContainers(parsed));

    const void* bytes = sb_packbuff_get_bytes(reply.get());
    const size_t size = sb_packbuff_get_size(reply.get());
    int error = 0;
    *replyData = BTHMakeSealedMemory(bytes, size, &error);
    if (!*replyData) {
        BTHLogError("vm_read(%p, %lu) fails: %d", bytes, static_cast<unsigned long>(size), error);
        return error;
    }
    *replySize = static_cast<uint32_t>(size);
    BTHLogDebug("packbuff bytes: %p, reply bytes: %p, reply size: %u", bytes,
                static_cast<const void*>(replyData), *replySize);
    return 0;
}

}  // namespace berth

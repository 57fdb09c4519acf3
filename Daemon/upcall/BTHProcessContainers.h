// The process-containers routine of the upcall: for a process the kernel's
// sandbox is starting, every directory it may use (its data container and the
// "tmp" inside it, its user's home directory, its application-group
// containers, its system container and its system-group containers), found
// or created on demand, answered as a reply pack buffer.
#pragma once

#include <cstdint>
#include <string>

#include "platform/UniqueFd.h"

namespace berth {

// Request item value types.
enum : uint16_t {
    BT_KERN_REQUEST_CODE_SIGNATURE_ID = 0,
    BT_KERN_REQUEST_CONTAINER_ID = 1,
    BT_KERN_REQUEST_APPLICATION_ID = 2,
    BT_KERN_REQUEST_PERSONA_ID = 3,
    BT_KERN_REQUEST_APP_GROUP_ID = 4,
    BT_KERN_REQUEST_CONTAINER_TYPE = 5,
    BT_KERN_REQUEST_SYSTEM_CONTAINER_ID = 6,
    BT_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID = 7,
};

// Reply item value types.
enum : uint16_t {
    BT_KERN_REPLY_SUCCESS = 0,
    BT_KERN_REPLY_DATA_CONTAINER_PATH = 1,
    BT_KERN_REPLY_TEMP_DIR_PATH = 2,
    BT_KERN_REPLY_APP_GROUP_ID = 3,
    BT_KERN_REPLY_APP_GROUP_PATH = 4,
    BT_KERN_REPLY_HOME_DIR_PATH = 100,
    BT_KERN_REPLY_SYSTEM_CONTAINER_PATH = 101,
    BT_KERN_REPLY_SYSTEM_GROUP_ID = 102,
    BT_KERN_REPLY_SYSTEM_GROUP_PATH = 103,
};

// The sandbox's container type of a request.
inline constexpr uint32_t kBTHSandboxContainerTypeApplication = 0;
inline constexpr uint32_t kBTHSandboxContainerTypePlugin = 1;

// Answers the request pack buffer of `requestSize` bytes at `requestData`.
// Returns 0 with the reply pack buffer in `replyData` (a sealed memory file
// of `*replySize` bytes, handed to the requester), 4 for an unknown item, 5
// for an item that cannot be read, 9 when out of memory, or the error of
// copying the reply. A container that cannot be found or created does not
// fail the routine: the reply then holds only the success item, with 0.
// Containers are created as a side effect; the daemon's own client object is
// left allowed to look up other identifiers and groups.
int32_t server_get_process_containers(const uint8_t* requestData, uint32_t requestSize,
                                      UniqueFd* replyData, uint32_t* replySize);

// The data container class a request's container type selects, given the
// class the code-signing store records for `identifier` (0 when none).
uint64_t BTHUpcallDataContainerClass(uint32_t containerType, uint64_t storedClass,
                                     const std::string& identifier);

}  // namespace berth

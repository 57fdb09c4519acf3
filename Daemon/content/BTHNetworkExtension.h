// Network extensions: the network-extension session daemon has a data
// container made for a network plug-in and recorded in the sandbox's
// container mapping under the network-extension agent's identifier, so the
// agent that runs the plug-in is given that container.
//
// Only the session daemon may do this (and, on internal builds, the test
// tool). The caller is recognised by its signing identifier, the one the
// code-signing registry bound to the executable it runs, never by a process
// name, which any process can choose.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>

#include "BTHClientConnection.h"

namespace berth {

// The network-extension session daemon, and the test tool that may act as
// it on internal builds.
inline constexpr const char* kBTHNetworkExtensionCaller = "sys.kelp.tunnelsessiond";
inline constexpr const char* kBTHNetworkExtensionTestCaller = "sys.kelp.BerthTest";
// The identifier the container is recorded under in the sandbox mapping.
inline constexpr const char* kBTHNetworkExtensionAgent = "sys.kelp.tunnelagentd";

// Whether `client` is the network-extension caller.
bool BTHIsNetworkExtensionCaller(const BTHClientConnection& client);

// Finds or creates the container of `identifier` (class 2 or 6) for `userId`
// and records it for the agent. Codes through `error`: 11 for a missing
// identifier or another class, 49 for any other caller and when the
// mapping cannot be recorded, the create-or-look-up's own code when that
// fails, 40 on an exception.
void setNetworkExtensionForUser(BTHClientConnection& client, uid_t userId,
                                const std::optional<std::string>& identifier,
                                uint64_t containerClass, uint64_t* error);

}  // namespace berth

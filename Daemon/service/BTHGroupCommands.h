// The handlers of the group and system container commands (13 to 17). Like
// the container handlers they read keys, validate users, choose defaults and
// fill reply keys; the group manager and the client object do the work, and
// the requests act for user 499 wherever system containers are meant.
#pragma once

#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

namespace berth {

// 13: the caller's (or the named identifier's) application-group
// containers, created on demand, as "ReplyGroupContainerDict".
void groupContainerPaths(const BTHRequestRef& request,
                         const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
// 14: the identifier's application groups as "ReplyGroupIdentifiersArray".
void groupContainerIdentifiers(const BTHRequestRef& request,
                               const std::shared_ptr<BTHClientConnection>& client,
                               uint64_t* replyError);
// 15: the identifier's system container; well-known ones are open to every
// caller.
void systemContainerPath(const BTHRequestRef& request,
                         const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
// 16: the identifier's system-group containers.
void systemGroupContainerPaths(const BTHRequestRef& request,
                               const std::shared_ptr<BTHClientConnection>& client,
                               uint64_t* replyError);
// 17: one system-group container, for an entitled identifier or a well-known
// group; 55 otherwise, 21 when no path could be had.
void systemGroupContainerPath(const BTHRequestRef& request,
                              const std::shared_ptr<BTHClientConnection>& client,
                              uint64_t* replyError);

}  // namespace berth

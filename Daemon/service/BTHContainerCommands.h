// The handlers of the container commands: each reads its request keys,
// validates the user for the class, calls one operation of the client object
// and turns its result into reply keys. They hold no logic of their own and
// no locks; the operations lock what they touch.
#pragma once

#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

namespace berth {

void createOrLookupContainer(const BTHRequestRef& request,
                             const std::shared_ptr<BTHClientConnection>& client,
                             uint64_t* replyError);
void listContainers(const BTHRequestRef& request,
                    const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
void setInfoValue(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
                  uint64_t* replyError);
void getInfoValue(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
                  uint64_t* replyError);
void getContainerMetadata(const BTHRequestRef& request,
                          const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
// Commands 8 and 22.
void recreateDefaultStructure(const BTHRequestRef& request,
                              const std::shared_ptr<BTHClientConnection>& client,
                              uint64_t* replyError);
void replaceContainer(const BTHRequestRef& request,
                      const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
void stageContainerForDelete(const BTHRequestRef& request,
                             const std::shared_ptr<BTHClientConnection>& client,
                             uint64_t* replyError);
// Replies from the completion, once death row has been emptied.
void deleteContainersOnDeathRow(const BTHRequestRef& request,
                                const std::shared_ptr<BTHClientConnection>& client,
                                uint64_t* replyError);
void regenerateDirectoryUUID(const BTHRequestRef& request,
                             const std::shared_ptr<BTHClientConnection>& client,
                             uint64_t* replyError);
void deleteContainer(const BTHRequestRef& request,
                     const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
// Only the plug-in data identifiers the caller is entitled to wipe.
void wipePluginDataContainer(const BTHRequestRef& request,
                             const std::shared_ptr<BTHClientConnection>& client,
                             uint64_t* replyError);
void wipeDataContainer(const BTHRequestRef& request,
                       const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);

}  // namespace berth

#include "BTHCodeSigningCommands.h"

#include "BTHCodeSigningMapping.h"
#include "BTHLog.h"
#include "BTHRequestReaders.h"

namespace berth {

namespace {

// The store, or none (logged) in a process whose mapping file could not be
// read: nothing can be recorded there and nothing is known.
BTHCodeSigningMapping* store(const char* function) {
    BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
    if (!mapping) {
        BTH_FUNCTION("BTHCodeSigningCommands");
        BTHLog(BTHLogLevelError, "%s: the code-signing store is unavailable", function);
    }
    return mapping;
}

}  // namespace

void processCodeSigningInfo(const BTHRequestRef& request,
                            const std::shared_ptr<BTHClientConnection>&, uint64_t* replyError) {
    BTH_FUNCTION("processCodeSigningInfo");
    const Value& message = request->message();
    BTHCodeSigningMapping* mapping = store(bthFunctionName);
    if (!mapping) {
        BTHSetErrorCode(replyError, BTHErrorMappingWriteFailed);
        return;
    }
    const uint64_t code = mapping->processCodeSigningInfo(
        BTHRequestObject(message, "CodeSigningInfo"), BTHRequestString(message, "Identifier"),
        BTHRequestObject(message, "OptionsDictionary"));
    BTHSetErrorCode(replyError, code);
}

void getCodeSigningInfo(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>&,
                        uint64_t* replyError) {
    BTH_FUNCTION("getCodeSigningInfo");
    const std::optional<std::string> identifier =
        BTHRequestString(request->message(), "Identifier");
    BTHCodeSigningMapping* mapping = store(bthFunctionName);
    std::optional<Value> info;
    if (mapping && identifier) info = mapping->getCodeSigningInfoForIdentifier(*identifier);
    if (info && info->isDictionary())
        request->reply().set("ReplyInfoDictionary", std::move(*info));
    else
        BTHSetErrorCode(replyError, BTHErrorNotFound);
}

void invalidateCodeSigningInfo(const BTHRequestRef&, const std::shared_ptr<BTHClientConnection>&,
                               uint64_t* replyError) {
    BTH_FUNCTION("invalidateCodeSigningInfo");
    BTHCodeSigningMapping* mapping = store(bthFunctionName);
    BTHSetErrorCode(replyError,
                    mapping ? mapping->invalidateCodeSigningInfoForAppsWithoutBundleContainer()
                            : uint64_t{BTHErrorMappingWriteFailed});
}

}  // namespace berth

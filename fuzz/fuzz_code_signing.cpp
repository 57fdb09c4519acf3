// Arbitrary message bodies as a request to record code-signing information
// (its "CodeSigningInfo", "Identifier" and "OptionsDictionary"), processed
// into a store on a scratch root and read back by every query. The installer
// is trusted, but a caller's own entitlements reach the same processing, and
// no shape of them may crash the daemon, grant a group identifier that could
// be read as a path, or leave a store the daemon cannot read again.
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <span>

#include "BTHCodeSigningMapping.h"
#include "BTHGroupManager.h"
#include "BTHLog.h"
#include "BTHRequestReaders.h"
#include "core/RelayCodec.h"

namespace {

namespace fs = std::filesystem;
using namespace berth;

const fs::path& scratchRoot() {
    static const fs::path root = [] {
        std::string templ = (fs::temp_directory_path() / "berth-fuzz-codesign.XXXXXX").string();
        if (!mkdtemp(templ.data())) std::abort();
        return fs::path(templ);
    }();
    return root;
}

// Registered before the store is made, so it runs after the store is gone.
void removeScratchRoot() {
    std::error_code ignored;
    fs::remove_all(scratchRoot(), ignored);
}

// The store under test, with the group manager connected as at start-up.
struct Store {
    Store() {
        if (!mapping) std::abort();
        mapping->setHooks(BTHMakeCodeSigningHooks(groups));
    }
    std::unique_ptr<BTHCodeSigningMapping> mapping = BTHCodeSigningMapping::create();
    BTHGroupManager groups{mapping.get()};
};

Store& store() {
    static Store instance;
    return instance;
}

void checkGroups(const std::optional<std::vector<std::string>>& groups) {
    if (!groups) return;
    for (const std::string& group : *groups)
        if (group.empty() || group == "." || group == ".." || group.find('/') != std::string::npos)
            std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    ::setenv("BERTH_ROOT", scratchRoot().c_str(), 1);
    std::atexit(removeScratchRoot);
    BTHLogSetHandle(std::make_shared<BTHLogHandle>("fuzz", 0));
    store();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Value message;
    if (!relay::decodeValue(std::span<const uint8_t>(data, size), message) ||
        !message.isDictionary())
        return 0;
    BTHCodeSigningMapping& mapping = *store().mapping;
    const std::optional<std::string> identifier = BTHRequestString(message, "Identifier");
    const uint64_t code =
        mapping.processCodeSigningInfo(BTHRequestObject(message, "CodeSigningInfo"), identifier,
                                       BTHRequestObject(message, "OptionsDictionary"));
    if (code != BTHErrorSuccess && code != BTHErrorIdentifierMissing &&
        code != BTHErrorInvalidArgument)
        std::abort();
    if (identifier) {
        checkGroups(mapping.appGroupIdentifiersForIdentifier(*identifier));
        checkGroups(mapping.systemGroupIdentifiersForIdentifier(*identifier));
        (void)mapping.identifierHasSystemContainer(*identifier);
        (void)mapping.getCodeSigningInfoForIdentifier(*identifier);
        uint64_t error = BTHErrorSuccess;
        checkGroups(store().groups.groupContainerIdentifiersForUser(501, identifier, &error));
    }
    // What was written reads back as the same mapping.
    std::unique_ptr<BTHCodeSigningMapping> reread = BTHCodeSigningMapping::create();
    if (!reread ||
        reread->codeSigningMappingDict().size() != mapping.codeSigningMappingDict().size())
        std::abort();
    for (const auto& [id, entry] : mapping.codeSigningMappingDict())
        if (!(*reread->codeSigningMappingDict().at(id) == *entry)) std::abort();
    // Keep the store small: drop what this input added.
    if (identifier) mapping.processCodeSigningInfo(std::nullopt, identifier, std::nullopt);
    return 0;
}

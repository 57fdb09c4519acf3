#include "BTHCodeSigningMapping.h"

#include <cerrno>
#include <cstring>

#include "BTHFaultInjection.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "BTHPropertyListFile.h"

namespace berth {

namespace {

constexpr const char* kCodeSignQueueLabel = "sys.kelp.Berth.EntitlementQueue";

// The mapping as log lines and error texts show it: identifier -> the
// entry's description.
Value describedMapping(const BTHCodeSigningMapping::Mapping& mapping) {
    Value described = Value::dictionary();
    for (const auto& [identifier, entry] : mapping)
        described.set(identifier, entry ? entry->description() : std::string("(null)"));
    return described;
}

// Staging compares what is stored with what is given; none is never equal
// to an entry, and an entry is always equal to itself.
bool sameEntry(const BTHCodeSigningEntry* stored, const BTHCodeSigningEntry* value) {
    if (!stored || !value) return stored == value;
    return *stored == *value;
}

}  // namespace

BTHCodeSigningMapping* BTHCodeSigningMapping::sharedInstance() {
    static const std::unique_ptr<BTHCodeSigningMapping> instance = create();
    return instance.get();
}

std::unique_ptr<BTHCodeSigningMapping> BTHCodeSigningMapping::create() {
    BTH_FUNCTION("-[BTHCodeSigningMapping init]");
    std::optional<Mapping> mapping = readCodeSigningMappingFromDisk();
    if (!mapping) {
        BTHLogError("Unable to read mapping file from disk.  This is bad");
        return nullptr;
    }
    return std::make_unique<BTHCodeSigningMapping>(Passkey{}, std::move(*mapping));
}

BTHCodeSigningMapping::BTHCodeSigningMapping(Passkey, Mapping mapping)
    : codeSignQueue_(WorkQueue::makeSerial(kCodeSignQueueLabel)),
      codeSigningMappingDict_(std::move(mapping)) {}

std::filesystem::path BTHCodeSigningMapping::mappingFileURL() {
    return BTHGlobalConfiguration::sharedInstance().libraryDirectory() /
           kBTHCodeSigningMappingFileName;
}

std::optional<BTHCodeSigningMapping::Mapping>
BTHCodeSigningMapping::readCodeSigningMappingFromDisk() {
    BTH_FUNCTION("-[BTHCodeSigningMapping _readCodeSigningMappingFromDisk]");
    const std::filesystem::path url = mappingFileURL();
    BTHErrorRef error;
    std::optional<Value> stored = BTH_dictionaryWithContentsOfURL(url, BTHReadImmutable, &error);
    Mapping mapping;
    if (!stored) {
        if (error && error->isPOSIXError(ENOENT)) {
            BTHLogNotice("No code signing info file found.  We will create one now");
            return mapping;
        }
        BTHLogError("Failed to read code signing mapping file at %@ : %@", url, error);
        return std::nullopt;
    }
    for (const auto& [identifier, value] : *stored->dictionaryValue())
        mapping.emplace(identifier, std::make_shared<BTHCodeSigningEntry>(
                                        BTHCodeSigningEntry::fromSerializedDictionary(value)));
    return mapping;
}

BTHErrorRef BTHCodeSigningMapping::writeCodeSigningMappingToDisk() {
    BTH_FUNCTION("-[BTHCodeSigningMapping _writeCodeSigningMappingToDisk]");
    // Every change of the mapping is written: answers given before it no
    // longer hold.
    version_.fetch_add(1);
    Value serialized = Value::dictionary();
    for (const auto& [identifier, entry] : codeSigningMappingDict_)
        if (entry) serialized.set(identifier, entry->serialize());
    const std::filesystem::path url = mappingFileURL();
    BTHErrorRef writeError;
    if (BTHFaultActive("mapping.write"))
        writeError = BTHMakePOSIXError(EIO, "write of %@ failed: %s", url, strerror(EIO));
    else if (BTH_writeToURL(serialized, url, kBTHStateFileWriteOptions, &writeError))
        return nullptr;
    return BTHMakeError(BTHErrorMappingWriteFailed, writeError,
                        "Failed to write entitlement mapping file at %@ : %@", url,
                        describedMapping(codeSigningMappingDict_));
}

BTHErrorRef BTHCodeSigningMapping::setCodeSigningDictionaryValues(
    const std::vector<BTHCodeSigningEntryRef>& values,
    const std::vector<std::string>& identifiers) {
    BTH_FUNCTION("-[BTHCodeSigningMapping _setCodeSigningDictionaryValues:forIdentifiers:]");
    if (values.size() != identifiers.size())
        return BTHMakeError(BTHErrorMappingInvalidInput, nullptr,
                            "Can't act on an invalid input: values count: %ld, IDs count: %ld",
                            values.size(), identifiers.size());

    bool changed = false;
    for (size_t i = 0; i < values.size(); ++i) {
        const std::string& identifier = identifiers[i];
        // An entry without code-signing information stores nothing: it
        // removes the identifier.
        BTHCodeSigningEntryRef value =
            values[i] && values[i]->codeSigningInfo() ? values[i] : nullptr;
        auto stored = codeSigningMappingDict_.find(identifier);
        const BTHCodeSigningEntry* storedEntry =
            stored == codeSigningMappingDict_.end() ? nullptr : stored->second.get();
        if (sameEntry(storedEntry, value.get())) continue;
        if (value)
            codeSigningMappingDict_[identifier] = value;
        else
            codeSigningMappingDict_.erase(stored);
        BTHLogDebug("Staging Code Signing Mapping for ID: %@ : %@", identifier, value);
        changed = true;
    }
    if (!changed) return nullptr;

    if (BTHErrorRef error = writeCodeSigningMappingToDisk()) {
        BTHLogError("Error writing code signing mappings to disk after set : %@", error);
        return error;
    }
    BTHLogDebug("Wrote code signing mappings to disk after set");
    return nullptr;
}

const BTHCodeSigningEntry* BTHCodeSigningMapping::storedEntry(const std::string& identifier) const {
    auto stored = codeSigningMappingDict_.find(identifier);
    return stored == codeSigningMappingDict_.end() ? nullptr : stored->second.get();
}

void BTHCodeSigningMapping::performExclusively(const std::function<void()>& work) {
    lockingAll([&] {
        work();
        return true;
    });
}

}  // namespace berth

#include "BTHLog.h"

#include <spdlog/sinks/stdout_sinks.h>

#include <atomic>
#include <cstdio>

#include "platform/JournalLog.h"
#include "platform/RotatingLogSink.h"

namespace berth {

namespace {

std::atomic<std::shared_ptr<BTHLogHandle>>& handleSlot() {
    static std::atomic<std::shared_ptr<BTHLogHandle>> slot;
    return slot;
}

std::string composeLine(int level, std::string_view function, std::string_view message);

thread_local const BTHLogIdentifierScope* tCurrentScope = nullptr;

void sendToJournal(int level, std::string_view function, std::string_view message,
                   std::optional<int64_t> code) {
    JournalField fields[3];
    size_t count = 0;
    fields[count++] = {"CODE_FUNC", function};
    const std::string codeText = code ? std::to_string(*code) : std::string();
    if (code) fields[count++] = {"BERTH_CODE", codeText};
    if (const std::string* identifier = BTHLogIdentifierScope::current())
        fields[count++] = {"BERTH_IDENTIFIER", *identifier};
    JournalSend(level, message, std::span<const JournalField>(fields, count));
}

void writeLine(int level, std::string_view function, std::string_view message,
               std::optional<int64_t> code) {
    if (std::shared_ptr<BTHLogHandle> handle = BTHLogGetHandle()) {
        handle->write(level, function, message);
        if (handle->journalLogging()) sendToJournal(level, function, message, code);
        return;
    }
    std::string line = composeLine(level, function, message);
    line.push_back('\n');
    fwrite(line.data(), 1, line.size(), stderr);
}

constexpr const char* kLinePattern = "%Y-%m-%d %H:%M:%S.%e %t %v";

std::string composeLine(int level, std::string_view function, std::string_view message) {
    std::string line;
    line.reserve(function.size() + message.size() + 16);
    line += "<";
    line += BTHLogLevelName(level);
    line += "> ";
    line += function;
    line += ": ";
    line += message;
    return line;
}

}  // namespace

const char* BTHLogLevelName(int level) {
    switch (level) {
        case BTHLogLevelError:
            return "error";
        case BTHLogLevelWarning:
            return "warning";
        case BTHLogLevelNotice:
            return "notice";
        case BTHLogLevelDebug:
            return "debug";
        default:
            return "log";
    }
}

BTHLogHandle::BTHLogHandle(std::string name, int threshold)
    : threshold_(threshold), logger_(std::make_shared<spdlog::logger>(std::move(name))) {
    logger_->set_level(spdlog::level::trace);
    logger_->flush_on(spdlog::level::trace);
}

bool BTHLogHandle::enableDiskLogging(const std::filesystem::path& path, uint32_t rotatedFiles,
                                     uint64_t sizeLimit) {
    try {
        addSink(std::make_shared<RotatingLogSink>(path, rotatedFiles, sizeLimit));
        return true;
    } catch (const spdlog::spdlog_ex&) {
        return false;
    }
}

void BTHLogHandle::addSink(spdlog::sink_ptr sink) {
    sink->set_pattern(kLinePattern);
    logger_->sinks().push_back(std::move(sink));
}

void BTHLogHandle::write(int level, std::string_view function, std::string_view message) {
    logger_->log(spdlog::level::info, composeLine(level, function, message));
}

std::shared_ptr<BTHLogHandle> BTHLogGetHandle() {
    return handleSlot().load();
}

void BTHLogSetHandle(std::shared_ptr<BTHLogHandle> handle) {
    handleSlot().store(std::move(handle));
}

bool BTHLogEnabled(int level) {
    std::shared_ptr<BTHLogHandle> handle = BTHLogGetHandle();
    if (!handle) return level <= BTHLogLevelNotice;
    return handle->threshold() >= level;
}

void BTHLogWrite(int level, std::string_view function, std::string_view message) {
    writeLine(level, function, message, std::nullopt);
}

void BTHLogWriteWithCode(int level, std::string_view function, std::string_view message,
                         int64_t code) {
    writeLine(level, function, message, code);
}

BTHLogIdentifierScope::BTHLogIdentifierScope(std::string identifier)
    : identifier_(std::move(identifier)), outer_(tCurrentScope) {
    tCurrentScope = this;
}

BTHLogIdentifierScope::~BTHLogIdentifierScope() {
    tCurrentScope = outer_;
}

const std::string* BTHLogIdentifierScope::current() {
    return tCurrentScope ? &tCurrentScope->identifier_ : nullptr;
}

}  // namespace berth

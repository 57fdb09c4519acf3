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

// The installed handle's threshold (notice without one), kept apart so that
// asking whether a level is logged, as hot paths do for every debug line,
// touches no shared reference count.
std::atomic<int>& effectiveThreshold() {
    static std::atomic<int> threshold{BTHLogLevelNotice};
    return threshold;
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

// The length of the well-formed UTF-8 sequence at `at` (0 when there is
// none) and its code point.
size_t utf8Sequence(std::string_view text, size_t at, uint32_t* codePoint) {
    const auto byte = [&](size_t i) { return static_cast<unsigned char>(text[i]); };
    const unsigned char lead = byte(at);
    size_t length = lead >= 0xF0 && lead <= 0xF4 ? 4 : lead >= 0xE0 ? 3 : lead >= 0xC2 ? 2 : 0;
    if (lead >= 0xF5 || length == 0 || at + length > text.size()) return 0;
    uint32_t value = lead & (0x7F >> length);
    for (size_t i = 1; i < length; ++i) {
        if ((byte(at + i) & 0xC0) != 0x80) return 0;
        value = value << 6 | (byte(at + i) & 0x3F);
    }
    const uint32_t smallest[] = {0, 0, 0x80, 0x800, 0x10000};
    if (value < smallest[length] || value > 0x10FFFF || (value >= 0xD800 && value <= 0xDFFF))
        return 0;
    *codePoint = value;
    return length;
}

void appendEscapedCodePoint(std::string& out, uint32_t codePoint) {
    char buffer[12];
    std::snprintf(buffer, sizeof buffer, "\\u%04X", codePoint);
    out += buffer;
}

void writeLine(int level, std::string_view function, std::string_view rawMessage,
               std::optional<int64_t> code) {
    const std::string message = BTHLogEscape(rawMessage);
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

namespace {
std::atomic<uint32_t> gLogFileCount{1};
}  // namespace

uint32_t BTHLogFileCount() {
    return gLogFileCount.load(std::memory_order_relaxed);
}

void BTHSetLogFileCount(uint32_t count) {
    gLogFileCount.store(count, std::memory_order_relaxed);
}

void BTHLogSetHandle(std::shared_ptr<BTHLogHandle> handle) {
    effectiveThreshold().store(handle ? handle->threshold() : int{BTHLogLevelNotice});
    handleSlot().store(std::move(handle));
}

void BTHLogHandle::setThreshold(int threshold) {
    threshold_ = threshold;
    if (BTHLogGetHandle().get() == this) effectiveThreshold().store(threshold);
}

bool BTHLogEnabled(int level) {
    return effectiveThreshold().load(std::memory_order_relaxed) >= level;
}

void BTHLogWrite(int level, std::string_view function, std::string_view message) {
    writeLine(level, function, message, std::nullopt);
}

void BTHLogWriteWithCode(int level, std::string_view function, std::string_view message,
                         int64_t code) {
    writeLine(level, function, message, code);
}

std::string BTHLogEscape(std::string_view text) {
    // One trailing newline ends the line the writer meant; it is not text.
    if (!text.empty() && text.back() == '\n') text.remove_suffix(1);
    std::string out;
    out.reserve(text.size());
    for (size_t i = 0; i < text.size();) {
        const unsigned char c = static_cast<unsigned char>(text[i]);
        // A tab moves the cursor but never to another line, and some of the
        // daemon's own lines are indented with one.
        if ((c >= 0x20 && c < 0x7F) || c == '\t') {
            out.push_back(static_cast<char>(c));
            ++i;
            continue;
        }
        uint32_t codePoint = 0;
        const size_t length = c >= 0x80 ? utf8Sequence(text, i, &codePoint) : 0;
        if (length > 0) {
            // C1 controls and the line and paragraph separators break lines
            // on some terminals and readers; other characters are kept.
            if (codePoint <= 0x9F || codePoint == 0x2028 || codePoint == 0x2029)
                appendEscapedCodePoint(out, codePoint);
            else
                out.append(text.substr(i, length));
            i += length;
            continue;
        }
        char buffer[8];
        switch (c) {
            case '\n':
                out += "\\n";
                break;
            case '\r':
                out += "\\r";
                break;
            default:
                std::snprintf(buffer, sizeof buffer, "\\x%02X", c);
                out += buffer;
        }
        ++i;
    }
    return out;
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

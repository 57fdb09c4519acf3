// The daemon's log: one rotating file "berthd.log", written from every queue.
//
// Levels: 3 error, 4 warning, 5 notice, 7 debug. A line is written when the
// guard of its level passes: levels 3 to 5 when there is no handle or the
// handle's threshold is at least the level; debug only when there is a handle
// whose threshold is at least 7. Without a handle, lines of levels 3 to 5 go
// to standard error (the service manager's journal). Every line carries the
// name of the function that writes it, "-[Class operation]" for operations of
// a class, the bare name for plain functions.
//
// In the code a function names itself once, and the log macros use it:
//
//     BTH_FUNCTION("-[BTHFileManager removeItemAtURL:error:]");
//     BTHLogNotice("Unset UF_IMMUTABLE on %s", path.c_str());
//
// The macros evaluate their arguments only when the line will be written.
//
// Under the service manager the lines also go to the journal, each with its
// level as priority and, where known, the error code it reports
// ("BERTH_CODE") and the identifier of the request being served
// ("BERTH_IDENTIFIER"); the scopes below say which.
#pragma once

#include <spdlog/logger.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "core/Format.h"

namespace berth {

enum BTHLogLevel : int {
    BTHLogLevelError = 3,
    BTHLogLevelWarning = 4,
    BTHLogLevelNotice = 5,
    BTHLogLevelDebug = 7,
};

class BTHLogHandle {
  public:
    // A handle under `name` with the given level threshold that writes
    // nowhere until disk logging is enabled.
    BTHLogHandle(std::string name, int threshold);

    // Starts writing to `path`, keeping `rotatedFiles` rotated files of at
    // most `sizeLimit` bytes. False if the file cannot be opened.
    bool enableDiskLogging(const std::filesystem::path& path, uint32_t rotatedFiles,
                           uint64_t sizeLimit);

    // Also sends every line to the journal, with its structured fields.
    void enableJournalLogging() { journal_ = true; }
    bool journalLogging() const { return journal_; }

    // Adds another destination (tests use this to see what was written).
    void addSink(spdlog::sink_ptr sink);

    int threshold() const { return threshold_; }
    // Takes effect at once when this is the installed handle.
    void setThreshold(int threshold);

    void write(int level, std::string_view function, std::string_view message);

  private:
    int threshold_;
    bool journal_ = false;
    std::shared_ptr<spdlog::logger> logger_;
};

// While one lives, the lines its thread writes carry `identifier` as the
// identifier being served. Scopes nest; the innermost wins.
class BTHLogIdentifierScope {
  public:
    explicit BTHLogIdentifierScope(std::string identifier);
    ~BTHLogIdentifierScope();
    BTHLogIdentifierScope(const BTHLogIdentifierScope&) = delete;
    BTHLogIdentifierScope& operator=(const BTHLogIdentifierScope&) = delete;

    // The identifier of the innermost scope of this thread, if any.
    static const std::string* current();

  private:
    std::string identifier_;
    const BTHLogIdentifierScope* outer_;
};

// `text` made safe to be one line of a log: control characters (C0 but the
// tab, DEL, C1), the line and paragraph separators and bytes that are not
// UTF-8 are written as escapes ("\n", "\r", "\x1B", "\u0085", "\u2028"); one
// trailing newline is dropped. Every line written goes through it, so a
// client's identifier or a name read from disk can never start a line of
// its own.
std::string BTHLogEscape(std::string_view text);

// Writes one line that reports the error `code` (the error objects use it).
void BTHLogWriteWithCode(int level, std::string_view function, std::string_view message,
                         int64_t code);

// The daemon's log handle; null until start-up opens it or when it could not
// be opened. Start-up sets it once before any other thread runs.
std::shared_ptr<BTHLogHandle> BTHLogGetHandle();
void BTHLogSetHandle(std::shared_ptr<BTHLogHandle> handle);

// The number of rotated log files the daemon keeps: 1, or 4 on internal
// builds. Set when the log is opened at start-up; the migration of old log
// files reads it.
uint32_t BTHLogFileCount();
void BTHSetLogFileCount(uint32_t count);

// The guard of every log call: true when a line of `level` is written.
bool BTHLogEnabled(int level);

// Writes one line under `function` (the guard must have passed).
void BTHLogWrite(int level, std::string_view function, std::string_view message);

// The text a level carries in a line: "error", "warning", "notice", "debug".
const char* BTHLogLevelName(int level);

}  // namespace berth

// Declares the name under which the enclosing function logs and makes errors.
#define BTH_FUNCTION(name) [[maybe_unused]] static constexpr const char* bthFunctionName = name

#define BTHLog(level, ...)                                                              \
    do {                                                                                \
        if (::berth::BTHLogEnabled(level))                                              \
            ::berth::BTHLogWrite(level, bthFunctionName, ::berth::format(__VA_ARGS__)); \
    } while (0)

#define BTHLogError(...) BTHLog(::berth::BTHLogLevelError, __VA_ARGS__)
#define BTHLogWarning(...) BTHLog(::berth::BTHLogLevelWarning, __VA_ARGS__)
#define BTHLogNotice(...) BTHLog(::berth::BTHLogLevelNotice, __VA_ARGS__)
#define BTHLogDebug(...) BTHLog(::berth::BTHLogLevelDebug, __VA_ARGS__)

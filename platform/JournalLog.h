// The system journal as a log destination: one entry per line, with the
// line's priority and structured fields beside the message, so an operator
// can filter the daemon's lines by error code or identifier.
#pragma once

#include <span>
#include <string_view>

namespace berth {

struct JournalField {
    std::string_view name;  // upper case, e.g. "BERTH_CODE"
    std::string_view value;
};

// Sends one entry with MESSAGE, PRIORITY (a syslog priority, 0-7),
// SYSLOG_IDENTIFIER "berthd" and `fields`. False when the journal did not
// take it (no journal on this system); the caller's other destinations are
// unaffected.
bool JournalSend(int priority, std::string_view message, std::span<const JournalField> fields);

}  // namespace berth

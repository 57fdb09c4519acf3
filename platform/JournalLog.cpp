#include "platform/JournalLog.h"

#include <sys/uio.h>

// The entry names the daemon's function itself (CODE_FUNC); the library's
// own location fields would name this file.
#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

#include <string>
#include <vector>

namespace berth {

namespace {

// "NAME=value" as the journal's native protocol takes a field.
std::string fieldText(std::string_view name, std::string_view value) {
    std::string text;
    text.reserve(name.size() + 1 + value.size());
    text.append(name).append("=").append(value);
    return text;
}

}  // namespace

bool JournalSend(int priority, std::string_view message, std::span<const JournalField> fields) {
    std::vector<std::string> texts;
    texts.reserve(fields.size() + 3);
    texts.push_back(fieldText("MESSAGE", message));
    texts.push_back(fieldText("PRIORITY", std::to_string(priority)));
    texts.push_back(fieldText("SYSLOG_IDENTIFIER", "berthd"));
    for (const JournalField& field : fields) texts.push_back(fieldText(field.name, field.value));

    std::vector<iovec> vector;
    vector.reserve(texts.size());
    for (std::string& text : texts) vector.push_back(iovec{text.data(), text.size()});
    return sd_journal_sendv(vector.data(), static_cast<int>(vector.size())) == 0;
}

}  // namespace berth

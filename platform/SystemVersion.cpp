#include "platform/SystemVersion.h"

#include <fstream>
#include <map>
#include <sstream>

#include "platform/DeviceRoot.h"

namespace berth {
namespace {

constexpr size_t kMaxOsReleaseSize = 64 << 10;

std::string unquote(const std::string& raw) {
    if (raw.size() >= 2 && raw.front() == '\'' && raw.back() == '\'')
        return raw.substr(1, raw.size() - 2);
    if (raw.size() < 2 || raw.front() != '"' || raw.back() != '"') return raw;
    std::string value;
    for (size_t i = 1; i + 1 < raw.size(); ++i) {
        if (raw[i] == '\\' && i + 2 < raw.size()) ++i;
        value.push_back(raw[i]);
    }
    return value;
}

}  // namespace

Value systemVersionFromOsRelease(const std::string& text) {
    std::map<std::string, std::string> fields;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        const size_t equals = line.find('=');
        if (line.empty() || line[0] == '#' || equals == std::string::npos || equals == 0) continue;
        fields[line.substr(0, equals)] = unquote(line.substr(equals + 1));
    }
    Value version = Value::dictionary();
    auto copy = [&](const char* field, const char* key) {
        if (auto it = fields.find(field); it != fields.end() && !it->second.empty())
            version.set(key, Value(it->second));
    };
    copy("VERSION_ID", kSystemVersionBuildKey);
    copy("BUILD_ID", kSystemVersionBuildKey);  // preferred over the version
    copy("RELEASE_TYPE", kSystemVersionReleaseTypeKey);
    copy("VERSION_ID", "Version");
    copy("NAME", "Name");
    return version;
}

std::optional<Value> systemVersionDictionary() {
    std::ifstream file(DeviceRoot::resolve("/etc/os-release"));
    if (!file) return std::nullopt;
    std::string text(kMaxOsReleaseSize, '\0');
    file.read(text.data(), static_cast<std::streamsize>(text.size()));
    if (file.bad()) return std::nullopt;
    text.resize(static_cast<size_t>(file.gcount()));
    return systemVersionFromOsRelease(text);
}

}  // namespace berth

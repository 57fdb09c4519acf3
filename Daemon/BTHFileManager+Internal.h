// Pieces shared by the file manager's source files.
#pragma once

#include <cstring>
#include <string>

namespace berth::filemanager {

// The text of an error number, as the messages quote it.
inline std::string errorText(int errnum) {
    char buffer[256];
    return ::strerror_r(errnum, buffer, sizeof buffer);
}

}  // namespace berth::filemanager

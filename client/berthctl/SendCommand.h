// "berthctl send": one raw request to the daemon, its reply printed back.
#pragma once

#include <chrono>
#include <filesystem>
#include <iosfwd>
#include <string>

namespace berth::ctl {

struct SendOptions {
    // The request as typed JSON; "-" reads it from standard input.
    std::string request;
    // Empty: the daemon's request socket under the device root.
    std::filesystem::path socket;
    std::chrono::milliseconds timeout{30000};
    // One line of JSON instead of the indented form.
    bool json = false;
};

// Sends the request and prints the typed reply on `out`. Returns the exit
// status (ExitStatus.h): the reply's "ReplyError" decides between success
// and failure, with the error line on `err`; a request that cannot be read
// is a usage error; a daemon that cannot be asked is a transport error, its
// description on `err`.
int runSend(const SendOptions& options, std::istream& in, std::ostream& out, std::ostream& err);

}  // namespace berth::ctl

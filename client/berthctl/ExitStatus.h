// The exit statuses of berthctl, the same for every subcommand, so scripts
// can tell "the daemon said no" from "the daemon could not be asked".
#pragma once

namespace berth::ctl {

// The operation did what was asked ("ReplyError" 1 for a request).
inline constexpr int kExitSuccess = 0;
// The operation was refused or failed: the daemon replied with an error code,
// or a local change (signature, lock state) could not be made.
inline constexpr int kExitFailure = 1;
// The daemon could not be asked or did not answer properly: not running,
// timed out, broke the connection or sent something that is not a reply.
inline constexpr int kExitTransport = 2;
// The command line itself is wrong (unknown option, malformed JSON, ...).
inline constexpr int kExitUsage = 64;

}  // namespace berth::ctl

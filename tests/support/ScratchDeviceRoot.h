// A scratch device root for a test program: a fresh directory holding
// etc/passwd, etc/group and the users' homes, named by BERTH_ROOT before
// anything reads it. The device root is read once per process, so a test
// program has one scratch root; it is removed when the program ends.
//
//   root 0           home /private/var/root
//   _bundles 33      home /private/var/ladingd
//   _system 499      home /private/var/empty
//   mobile 501       home /private/var/mobile   (unless withMobileUser is false)
//   other 502        home /private/var/other
//   group systemusers 510 (members: _system)
#pragma once

#include <filesystem>

namespace berth::test {

struct ScratchDeviceRootOptions {
    bool withMobileUser = true;
};

// Creates the scratch root (once) and points BERTH_ROOT at it. Call it before
// any daemon code runs: from a global test environment or a static
// initializer of the test program.
const std::filesystem::path& installScratchDeviceRoot(const ScratchDeviceRootOptions& options = {});

}  // namespace berth::test

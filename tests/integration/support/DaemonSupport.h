// What the integration tests share: the scratch device root, request
// builders, reply readers, a fixture that starts the daemon and speaks to it,
// and a runner of child programs.
#pragma once

#include <gtest/gtest.h>
#include <sys/types.h>

#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "DaemonProcess.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "libberth/BerthConnection.h"

namespace berth::test {

// The scratch device root of this program, installed on first use.
const std::filesystem::path& deviceRoot();

inline const std::filesystem::path kDataClassDirectory =
    "private/var/mobile/Containers/Data/Application";
inline const std::filesystem::path kStagingDirectory =
    "private/var/root/Library/Caches/sys.kelp.berthd/Staging";
inline const std::filesystem::path kDeathRowDirectory =
    "private/var/root/Library/Caches/sys.kelp.berthd/Dead";
inline const std::filesystem::path kReplaceDirectory = "private/var/root/Library/Berth/Replace";

Value request(uint64_t command, uint64_t containerClass, uint64_t user,
              std::optional<std::string> identifier = std::nullopt);
// Command 0: find (and unless told otherwise create) a container.
Value create(uint64_t containerClass, uint64_t user, const std::string& identifier,
             bool transient = false, bool createIfNecessary = true);
// A request about the container an earlier reply names.
Value about(uint64_t command, uint64_t containerClass, uint64_t user, const Value& created);

// "ReplyError" of a reply (0 when none), and a string member ("" when none).
uint64_t code(const Value& reply);
std::string text(const Value& reply, const char* key);

// Names in a directory, sorted; none when it does not exist.
std::vector<std::string> listing(const std::filesystem::path& directory);
// The daemon's rotating log on the scratch root, as written so far.
std::string daemonLog();
// Waits (bounded) for the background emptying of death row.
bool deathRowEmpties();

// Registers this test program under `identifier` with `entitlements`.
void signSelf(const std::string& identifier, const Value& entitlements);

// A daemon on the scratch root, started anew by start(), and a connection.
class DaemonFixture : public ::testing::Test {
  protected:
    void SetUp() override;
    void TearDown() override;
    void start(std::map<std::string, std::string> environment = {});
    Value call(const Value& message);

    std::optional<DaemonProcess> daemon_;
    std::unique_ptr<BerthConnection> connection_;
};

// What a child program printed and its exit status (128 + signal).
struct Outcome {
    int status = -1;
    std::string out;
    std::string err;
};
// Runs `program` with `args`, as `user` when given.
Outcome run(const std::filesystem::path& program, const std::vector<std::string>& args,
            std::optional<uid_t> user = std::nullopt);

}  // namespace berth::test

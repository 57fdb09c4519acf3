#include "MaintenanceCommands.h"

#include <ostream>
#include <thread>

#include "ExitStatus.h"
#include "core/ValueJson.h"
#include "libberth/BerthMaintenance.h"

namespace berth::ctl {

namespace {

int fail(const ContainerError& failure, std::ostream& err) {
    err << "error: " << failure.describe() << "\n";
    if (failure.isReplyError()) return kExitFailure;
    return failure.transport.code == BerthError::Code::InvalidRequest ? kExitUsage : kExitTransport;
}

std::unique_ptr<BerthConnection> connectTo(const MaintenanceOptions& options, BerthError* error) {
    return options.socket.empty() ? BerthConnection::connect(error)
                                  : BerthConnection::connect(options.socket, error);
}

// A connection to the daemon, waiting up to `wait` for it to come back.
std::unique_ptr<BerthConnection> reconnect(const MaintenanceOptions& options, BerthError* error) {
    const auto deadline = std::chrono::steady_clock::now() + options.reconnectWait;
    for (;;) {
        if (auto connection = connectTo(options, error)) return connection;
        if (std::chrono::steady_clock::now() >= deadline) return nullptr;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
}

int migrate(const MaintenanceOptions& options, std::ostream& out, std::ostream& err) {
    BerthError error;
    const std::unique_ptr<BerthConnection> connection = connectTo(options, &error);
    if (!connection) return fail(ContainerError{0, "", error.message, error}, err);
    ContainerError failure;
    if (!BerthMaintenance(*connection, options.timeout).performDataMigration(&failure))
        return fail(failure, err);
    out << (options.json ? "{}" : "data migration done") << "\n";
    return kExitSuccess;
}

// Repeats the request on a fresh connection after each exit of the daemon;
// a round that neither succeeds nor ends the connection is a failure.
int retryTest(const MaintenanceOptions& options, std::ostream& out, std::ostream& err) {
    uint64_t exits = 0;
    for (;;) {
        BerthError error;
        const std::unique_ptr<BerthConnection> connection = reconnect(options, &error);
        if (!connection) return fail(ContainerError{0, "", error.message, error}, err);
        ContainerError failure;
        if (BerthMaintenance(*connection, options.timeout)
                .retryTest(options.user, options.crashes, &failure))
            break;
        if (failure.isReplyError() || failure.transport.code != BerthError::Code::ConnectionClosed)
            return fail(failure, err);
        ++exits;
    }
    if (options.json) {
        Value result = Value::dictionary();
        result.set("exits", exits);
        out << valueToJson(result) << "\n";
    } else {
        out << "retry test succeeded after " << exits << " daemon exit" << (exits == 1 ? "" : "s")
            << "\n";
    }
    return kExitSuccess;
}

}  // namespace

int runMaintenanceCommand(const MaintenanceOptions& options, std::ostream& out, std::ostream& err) {
    return options.action == MaintenanceAction::Migrate ? migrate(options, out, err)
                                                        : retryTest(options, out, err);
}

}  // namespace berth::ctl

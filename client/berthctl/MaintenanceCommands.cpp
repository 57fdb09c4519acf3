#include "MaintenanceCommands.h"

#include <sys/socket.h>
#include <sys/types.h>

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

// The daemon process at the other end of `connection` (the one listening
// when it connected); 0 when the kernel does not say.
pid_t daemonProcessOf(const BerthConnection& connection) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(connection.socket(), SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0)
        return 0;
    return credentials.pid;
}

// Repeats the request on a fresh connection after each exit of the daemon;
// a round that neither succeeds nor ends the connection is a failure. An
// exit is counted once per daemon process: a reconnect can still reach the
// listening socket of the daemon that is exiting, whose closing then ends
// that connection too.
int retryTest(const MaintenanceOptions& options, std::ostream& out, std::ostream& err) {
    uint64_t exits = 0;
    pid_t exited = 0;
    for (;;) {
        BerthError error;
        const std::unique_ptr<BerthConnection> connection = reconnect(options, &error);
        if (!connection) return fail(ContainerError{0, "", error.message, error}, err);
        const pid_t daemon = daemonProcessOf(*connection);
        ContainerError failure;
        if (BerthMaintenance(*connection, options.timeout)
                .retryTest(options.user, options.crashes, &failure))
            break;
        if (failure.isReplyError() || failure.transport.code != BerthError::Code::ConnectionClosed)
            return fail(failure, err);
        if (daemon == 0 || daemon != exited) ++exits;
        exited = daemon;
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

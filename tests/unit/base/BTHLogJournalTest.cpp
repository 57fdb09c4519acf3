// Lines sent to the journal: the priority of their level and the structured
// fields an operator filters by. The journal is played by a datagram socket
// at the journal's own path, inside a private mount namespace of a child
// process, so the host's journal sees nothing.
#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>

#include <spdlog/sinks/ostream_sink.h>

#include <cstring>
#include <functional>
#include <map>
#include <sstream>

#include "BTHError.h"
#include "BTHLog.h"
#include "TestSupport.h"

namespace berth {
namespace {

using Entry = std::map<std::string, std::string>;

// An entry of the journal's native protocol ("NAME=value" lines; the
// length-prefixed form of values with newlines is not used by these lines).
Entry parseEntry(const std::string& datagram) {
    Entry entry;
    size_t start = 0;
    while (start < datagram.size()) {
        size_t end = datagram.find('\n', start);
        if (end == std::string::npos) end = datagram.size();
        const std::string line = datagram.substr(start, end - start);
        if (size_t eq = line.find('='); eq != std::string::npos)
            entry[line.substr(0, eq)] = line.substr(eq + 1);
        start = end + 1;
    }
    return entry;
}

// In a child with its own /run: a journal socket, then `log`; the
// datagrams it received come back through a pipe, separated by NULs.
std::vector<Entry> journalEntriesOf(const std::function<void()>& log) {
    int pipeFds[2];
    if (::pipe2(pipeFds, O_CLOEXEC) != 0) return {};
    UniqueFd readEnd(pipeFds[0]), writeEnd(pipeFds[1]);
    const pid_t child = ::fork();
    if (child == 0) {
        if (::unshare(CLONE_NEWNS) != 0 ||
            ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            ::mount("tmpfs", "/run", "tmpfs", 0, "mode=0755") != 0)
            _exit(3);
        std::filesystem::create_directories("/run/systemd/journal");
        UniqueFd journal(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strcpy(address.sun_path, "/run/systemd/journal/socket");
        if (::bind(journal.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
            _exit(4);
        log();
        char buffer[65536];
        ssize_t n;
        while ((n = ::recv(journal.get(), buffer, sizeof buffer, MSG_DONTWAIT)) > 0) {
            if (::write(writeEnd.get(), buffer, n) != n || ::write(writeEnd.get(), "", 1) != 1)
                _exit(5);
        }
        _exit(0);
    }
    writeEnd.reset();
    std::string all;
    char buffer[4096];
    ssize_t n;
    while ((n = ::read(readEnd.get(), buffer, sizeof buffer)) > 0) all.append(buffer, n);
    int status = 0;
    ::waitpid(child, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "child status " << status;
    std::vector<Entry> entries;
    size_t start = 0;
    for (size_t end; (end = all.find('\0', start)) != std::string::npos; start = end + 1)
        entries.push_back(parseEntry(all.substr(start, end - start)));
    return entries;
}

class BTHLogJournalTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        previous_ = BTHLogGetHandle();
    }
    void TearDown() override { BTHLogSetHandle(previous_); }

    // A handle at notice level that writes to the journal and to `file`.
    static void useJournalHandle(std::shared_ptr<std::ostringstream> file) {
        auto handle = std::make_shared<BTHLogHandle>("berthd", BTHLogLevelNotice);
        handle->enableJournalLogging();
        handle->addSink(std::make_shared<spdlog::sinks::ostream_sink_mt>(*file));
        BTHLogSetHandle(handle);
    }

    std::shared_ptr<BTHLogHandle> previous_;
};

TEST_F(BTHLogJournalTest, LinesCarryPriorityCodeAndTheIdentifierBeingServed) {
    auto file = std::make_shared<std::ostringstream>();
    const std::vector<Entry> entries = journalEntriesOf([&] {
        useJournalHandle(file);
        BTH_FUNCTION("-[BTHClientConnection deleteContainer:error:]");
        BTHLogNotice("outside any request");
        {
            BTHLogIdentifierScope served("com.example.notes");
            BTHLogWarning("about to fail");
            BTHErrorRef error =
                BTHMakeError(BTHErrorNotFound, nullptr, "no container for %@", "com.example.notes");
            {
                BTHLogIdentifierScope inner("com.example.notes.plugin");
                BTHLogNotice("inner scope");
            }
            BTHLogNotice("back in the outer scope");
        }
        BTHLogDebug("below the threshold");
        if (file->str().find("back in the outer scope") == std::string::npos) _exit(6);
    });
    ASSERT_EQ(entries.size(), 5u);

    EXPECT_EQ(entries[0].at("MESSAGE"), "outside any request");
    EXPECT_EQ(entries[0].at("PRIORITY"), "5");
    EXPECT_EQ(entries[0].at("SYSLOG_IDENTIFIER"), "berthd");
    EXPECT_EQ(entries[0].at("CODE_FUNC"), "-[BTHClientConnection deleteContainer:error:]");
    EXPECT_EQ(entries[0].count("BERTH_IDENTIFIER"), 0u);
    EXPECT_EQ(entries[0].count("BERTH_CODE"), 0u);

    EXPECT_EQ(entries[1].at("PRIORITY"), "4");
    EXPECT_EQ(entries[1].at("BERTH_IDENTIFIER"), "com.example.notes");
    EXPECT_EQ(entries[1].count("BERTH_CODE"), 0u);

    EXPECT_EQ(entries[2].at("PRIORITY"), "3");
    EXPECT_EQ(entries[2].at("BERTH_CODE"), std::to_string(BTHErrorNotFound));
    EXPECT_EQ(entries[2].at("BERTH_IDENTIFIER"), "com.example.notes");
    EXPECT_NE(entries[2].at("MESSAGE").find("no container for com.example.notes"),
              std::string::npos);

    EXPECT_EQ(entries[3].at("BERTH_IDENTIFIER"), "com.example.notes.plugin");
    EXPECT_EQ(entries[4].at("BERTH_IDENTIFIER"), "com.example.notes");
}

TEST_F(BTHLogJournalTest, TheRotatingFileKeepsEveryLineAndWithoutJournalNothingIsSent) {
    auto file = std::make_shared<std::ostringstream>();
    std::string written;
    const std::vector<Entry> entries = journalEntriesOf([&] {
        auto handle = std::make_shared<BTHLogHandle>("berthd", BTHLogLevelNotice);
        handle->addSink(std::make_shared<spdlog::sinks::ostream_sink_mt>(*file));
        BTHLogSetHandle(handle);
        BTH_FUNCTION("main");
        BTHLogNotice("to the file only");
        written = file->str();
        if (written.find("<notice> main: to the file only") == std::string::npos) _exit(6);
    });
    EXPECT_TRUE(entries.empty());
}

}  // namespace
}  // namespace berth

// The process-containers upcall through the daemon's real upcall socket: the
// answer's items and order for apps, plug-ins and unknown identifiers, homes
// of different users, groups, and every refusal of a malformed request or of
// a sender that is not the kernel.
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>

#include "BTHCodeSigningMapping.h"
#include "DaemonSupport.h"
#include "core/UpcallWire.h"
#include "packbuff/packbuff.h"
#include "platform/UpcallTransport.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using test::deviceRoot;

// One reply item: its value type and its string or number.
struct Item {
    uint16_t type;
    std::string text;
    uint32_t number = 0;
    bool operator==(const Item&) const = default;
};

std::ostream& operator<<(std::ostream& out, const Item& item) {
    return out << item.type << ":" << (item.text.empty() ? std::to_string(item.number) : item.text);
}

// A request pack buffer built item by item.
class RequestBuilder {
  public:
    RequestBuilder() : pb_(sb_packbuff_new(256)) {}
    ~RequestBuilder() { sb_packbuff_free(pb_); }
    RequestBuilder& string(uint16_t type, const std::string& value) {
        EXPECT_EQ(sb_packbuff_pack_string(pb_, type, value.c_str(), value.size()), 0);
        return *this;
    }
    RequestBuilder& number(uint16_t type, uint32_t value) {
        EXPECT_EQ(sb_packbuff_pack_uint32(pb_, type, value), 0);
        return *this;
    }
    std::vector<uint8_t> bytes() const {
        const auto* data = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb_));
        return {data, data + sb_packbuff_get_size(pb_)};
    }

  private:
    sb_packbuff* pb_;
};

// Every item of a reply pack buffer, in order.
std::vector<Item> itemsOf(std::vector<uint8_t> data) {
    std::vector<Item> items;
    sb_packbuff* pb = sb_packbuff_init_with_buffer(data.data(), data.size(), true, 0);
    uint16_t type = 0;
    while (pb && sb_packbuff_get_item_value_type(pb, &type)) {
        int error = 0;
        if (type == 0) {
            items.push_back({type, "", sb_packbuff_unpack_uint32(pb, &error)});
        } else {
            const char* text = sb_packbuff_unpack_string(pb, nullptr, &error);
            items.push_back({type, text ? text : "", 0});
        }
        if (error) {
            ADD_FAILURE() << "unreadable reply item of type " << type << ": " << error;
            break;
        }
    }
    sb_packbuff_free(pb);
    return items;
}

class DaemonUpcallTest : public test::DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (HasFatalFailure() || IsSkipped()) return;
        // The store's data container classes, as the installer would have
        // reported them, before the daemon reads the mapping.
        fs::remove_all(deviceRoot() / "private/var/root/Library/Berth");
        auto mapping = BTHCodeSigningMapping::create();
        ASSERT_TRUE(mapping);
        ASSERT_FALSE(mapping->setCodeSigningDictionaryValues(
            {std::make_shared<BTHCodeSigningEntry>(Value::dictionary(), 2),
             std::make_shared<BTHCodeSigningEntry>(Value::dictionary(), 4)},
            {"com.example.app", "com.example.plugin"}));
        ASSERT_NO_FATAL_FAILURE(start());
    }

    BTHUpcallAnswer ask(const RequestBuilder& request) { return askRaw(request.bytes()); }

    BTHUpcallAnswer askRaw(const std::vector<uint8_t>& data) {
        int error = 0;
        auto client = BTHUpcallClient::connect(socketPath(), &error);
        EXPECT_TRUE(client) << strerror(error);
        if (!client) return {};
        auto answer = client->call(data, &error);
        EXPECT_TRUE(answer) << strerror(error);
        return answer ? *answer : BTHUpcallAnswer{};
    }

    fs::path socketPath() const { return deviceRoot() / "run/berthd/sys.kelp.berthd.upcall"; }
    fs::path home(const char* relative) const { return fs::canonical(deviceRoot() / relative); }
    static fs::path classDirectory(const char* name) {
        return deviceRoot() / "private/var/mobile/Containers" / name;
    }
};

// The directory holding `path` and whether both exist.
void expectContainerIn(const fs::path& path, const fs::path& classDirectory) {
    EXPECT_EQ(fs::path(path).parent_path(), classDirectory);
    EXPECT_TRUE(fs::is_directory(path)) << path;
}

TEST_F(DaemonUpcallTest, AnAppGetsHomeDataTmpAndSuccessInOrder) {
    const auto answer = ask(RequestBuilder().string(0, "com.example.app").number(3, 501));
    ASSERT_EQ(answer.returnCode, 0);
    const auto items = itemsOf(answer.replyData);
    ASSERT_EQ(items.size(), 4u);
    EXPECT_EQ(items[0], (Item{100, home("private/var/mobile").string()}));
    EXPECT_EQ(items[1].type, 1);
    expectContainerIn(items[1].text, classDirectory("Data/Application"));
    EXPECT_EQ(items[2], (Item{2, (fs::path(items[1].text) / "tmp").string()}));
    EXPECT_EQ(items[3], (Item{0, "", 1}));
    // The same request again finds the same container.
    EXPECT_EQ(
        itemsOf(ask(RequestBuilder().string(0, "com.example.app").number(3, 501)).replyData)[1],
        items[1]);
}

TEST_F(DaemonUpcallTest, TheContainerTypeAndTheStoreChooseTheClass) {
    const struct {
        const char* identifier;
        uint32_t type;
        const char* classDirectory;
        const char* logLine;
    } cases[] = {
        {"com.example.app", 1, "Data/SprocketPlugin",
         "SB Type: 1, LD Type: 2.  Declaring this a plugin"},
        {"com.example.plugin", 0, "Data/SprocketPlugin", "SB type is app, but LD type is 4"},
        {"com.example.unknown", 0, "Data/Application",
         "Invalid data container class for com.example.unknown: 0"},
        {"com.example.unknown-plugin", 1, "Data/SprocketPlugin",
         "SB Type: 1, falling back to class: 4"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.identifier);
        const auto items =
            itemsOf(ask(RequestBuilder().string(0, c.identifier).number(3, 501).number(5, c.type))
                        .replyData);
        ASSERT_EQ(items.size(), 4u);
        expectContainerIn(items[1].text, classDirectory(c.classDirectory));
        EXPECT_NE(test::daemonLog().find(c.logLine), std::string::npos);
    }
}

TEST_F(DaemonUpcallTest, AContainerIdentifierOverridesTheSigningIdentifier) {
    const auto items = itemsOf(ask(RequestBuilder()
                                       .string(0, "com.example.signer")
                                       .string(1, "com.example.app")
                                       .string(2, "ignored.application.id")
                                       .number(3, 501))
                                   .replyData);
    ASSERT_EQ(items.size(), 4u);
    // The container is the app's: asking as the app finds the same one, and
    // the signer got none.
    EXPECT_EQ(itemsOf(ask(RequestBuilder().string(0, "com.example.app").number(3, 501))
                          .replyData)[1],
              items[1]);
    EXPECT_EQ(test::listing(classDirectory("Data/Application")).size(), 1u);
}

TEST_F(DaemonUpcallTest, HomesFollowThePersona) {
    // No identifier at all: only the home directory and success.
    EXPECT_EQ(itemsOf(ask(RequestBuilder()).replyData),
              (std::vector<Item>{{100, (deviceRoot() / "private/var/root").string()}, {0, "", 1}}));
    EXPECT_EQ(itemsOf(ask(RequestBuilder().number(3, 501)).replyData)[0],
              (Item{100, home("private/var/mobile").string()}));
}

TEST_F(DaemonUpcallTest, GroupsComeAsIdentifierAndPathPairs) {
    const auto items = itemsOf(ask(RequestBuilder()
                                       .string(0, "com.example.app")
                                       .number(3, 501)
                                       .string(4, "group.one")
                                       .string(4, "group.two")
                                       .string(6, "com.example.service")
                                       .string(7, "systemgroup.shared"))
                                   .replyData);
    ASSERT_EQ(items.size(), 11u);
    EXPECT_EQ(items[3], (Item{3, "group.one"}));
    EXPECT_EQ(items[4].type, 4);
    expectContainerIn(items[4].text, classDirectory("Shared/AppGroup"));
    EXPECT_EQ(items[5], (Item{3, "group.two"}));
    EXPECT_NE(items[6].text, items[4].text);
    EXPECT_EQ(items[7].type, 101);
    expectContainerIn(items[7].text, deviceRoot() / "private/var/containers/Data/System");
    EXPECT_EQ(items[8], (Item{102, "systemgroup.shared"}));
    EXPECT_EQ(items[9].type, 103);
    expectContainerIn(items[9].text, deviceRoot() / "private/var/containers/Shared/SystemGroup");
    EXPECT_EQ(items[10], (Item{0, "", 1}));
}

TEST_F(DaemonUpcallTest, OneGroupThatCannotBeHadLeavesOnlyTheFailedSuccessItem) {
    // A group whose metadata file vanished behind the daemon cannot be looked
    // up again in this run.
    const auto first =
        itemsOf(ask(RequestBuilder().number(3, 501).string(4, "group.broken")).replyData);
    ASSERT_EQ(first.size(), 4u);
    fs::remove(fs::path(first[2].text) / ".sys.kelp.berth.metadata.plist");

    const auto items = itemsOf(ask(RequestBuilder()
                                       .string(0, "com.example.app")
                                       .number(3, 501)
                                       .string(4, "group.one")
                                       .string(4, "group.broken")
                                       .string(4, "group.three"))
                                   .replyData);
    EXPECT_EQ(items, (std::vector<Item>{{0, "", 0}}));
    EXPECT_NE(test::daemonLog().find("createOrLookupGroupContainersForUser: Failed with error: "),
              std::string::npos);
}

TEST_F(DaemonUpcallTest, MalformedItemsAreRefusedBeforeAnythingIsCreated) {
    // A value type the interface does not know.
    EXPECT_EQ(ask(RequestBuilder().string(0, "com.example.never").number(8, 1)).returnCode,
              kBTHUpcallUnknownItem);
    // A string item whose last byte is not its NUL.
    std::vector<uint8_t> unterminated = {2, 0, 0, 0, 3, 0, 0, 0, 'a', 'b', 'c', 0,
                                         0, 0, 0, 0, 0, 0, 0, 0, 0,   0,   0,   0};
    EXPECT_EQ(askRaw(unterminated).returnCode, kBTHUpcallBadItemOrSender);
    // A number where a string belongs, and an item running past the end.
    EXPECT_EQ(ask(RequestBuilder().number(0, 7)).returnCode, kBTHUpcallBadItemOrSender);
    EXPECT_EQ(askRaw({2, 0, 0, 0, 200, 0, 0, 0}).returnCode, kBTHUpcallBadItemOrSender);
    EXPECT_NE(test::daemonLog().find("unexpected value: 8"), std::string::npos);
    EXPECT_TRUE(test::listing(classDirectory("Data/Application")).empty());
}

TEST_F(DaemonUpcallTest, MalformedMessagesGetErrorReplies) {
    int error = 0;
    auto client = BTHUpcallClient::connect(socketPath(), &error);
    ASSERT_TRUE(client) << strerror(error);
    const std::vector<uint8_t> body = RequestBuilder().bytes();
    UniqueFd memory = BTHMakeSealedMemory(body.data(), body.size(), &error);
    auto message = [&](auto&& change) {
        auto bytes = BTHUpcallMakeRequest(0x1234, static_cast<uint32_t>(body.size()));
        std::vector<uint8_t> m(bytes.begin(), bytes.end());
        change(m);
        return m;
    };
    const struct {
        const char* what;
        std::vector<uint8_t> message;
        int attached;
        int32_t code;
    } cases[] = {
        {"no complex bit", message([](auto& m) { m[3] = 0; }), memory.get(),
         kBTHUpcallBadArguments},
        {"two descriptors", message([](auto& m) { m[24] = 2; }), memory.get(),
         kBTHUpcallBadArguments},
        {"short message", message([](auto& m) { m.resize(40); }), memory.get(),
         kBTHUpcallBadArguments},
        {"not out-of-line memory", message([](auto& m) { m[39] = 2; }), memory.get(),
         kBTHUpcallTypeError},
        {"sizes disagree", message([](auto& m) { m[48] += 8; }), memory.get(), kBTHUpcallTypeError},
        {"memory missing", message([](auto&) {}), -1, kBTHUpcallTypeError},
        {"second id", message([](auto& m) { m[20] += 1; }), memory.get(), kBTHUpcallBadMessageId},
        {"unknown id", message([](auto& m) { m[20] += 7; }), memory.get(), kBTHUpcallBadMessageId},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        auto answer = client->callRaw(c.message, c.attached, &error);
        ASSERT_TRUE(answer) << strerror(error);
        ASSERT_EQ(answer->message.size(), kBTHUpcallErrorReplySize);
        EXPECT_EQ(answer->returnCode, c.code);
        EXPECT_EQ(BTHUpcallField(answer->message.data(), upcall::kBits), 0x12u);
        EXPECT_EQ(BTHUpcallField(answer->message.data(), upcall::kRemotePort), 0x1234u);
        EXPECT_EQ(BTHUpcallField(answer->message.data(), upcall::kId),
                  BTHUpcallField(c.message.data(), upcall::kId) + 100);
    }
    // Memory the sender could still change is not taken.
    UniqueFd unsealed(::memfd_create("unsealed", MFD_CLOEXEC));
    ASSERT_EQ(::write(unsealed.get(), body.data(), body.size()), ssize_t(body.size()));
    auto answer = client->callRaw(message([](auto&) {}), unsealed.get(), &error);
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->returnCode, kBTHUpcallTypeError);
}

TEST_F(DaemonUpcallTest, ASenderThatIsNotTheKernelIsRefused) {
    // Only root may reach the socket on a real device; open it up so that an
    // app's user can try, reaching it through a descriptor of its directory
    // (the scratch root above it is closed to other users).
    ASSERT_EQ(::chmod(socketPath().c_str(), 0666), 0);
    UniqueFd directory(::open(socketPath().parent_path().c_str(), O_PATH | O_DIRECTORY));
    ASSERT_TRUE(directory);
    const fs::path reachable = "/proc/self/fd/" + std::to_string(directory.get()) + "/" +
                               socketPath().filename().string();
    const pid_t child = ::fork();
    if (child == 0) {
        if (::setgid(501) != 0 || ::setuid(501) != 0) _exit(2);
        int error = 0;
        auto client = BTHUpcallClient::connect(reachable, &error);
        if (!client) _exit(3);
        auto answer = client->call(RequestBuilder().string(0, "com.example.app").bytes(), &error);
        _exit(answer && answer->returnCode == kBTHUpcallBadItemOrSender ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    EXPECT_TRUE(test::listing(classDirectory("Data/Application")).empty());
}

}  // namespace
}  // namespace berth

// The upcall's sender side without a daemon: the request items a launcher
// sends, and answers read back, including answers that are not well formed.
#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <functional>

#include "packbuff/packbuff.h"
#include "upcall/BerthUpcall.h"

namespace berth {
namespace {

// A pack buffer written by `fill`.
std::vector<uint8_t> packed(const std::function<void(sb_packbuff*)>& fill) {
    sb_packbuff* pb = sb_packbuff_new(256);
    fill(pb);
    const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
    std::vector<uint8_t> data(bytes, bytes + sb_packbuff_get_size(pb));
    sb_packbuff_free(pb);
    return data;
}

void str(sb_packbuff* pb, uint16_t type, const char* text) {
    ASSERT_EQ(sb_packbuff_pack_string(pb, type, text, strlen(text)), 0);
}

TEST(BerthctlUpcallTest, RequestCarriesEveryGivenItemInOrder) {
    upcall::Request request;
    request.signingIdentifier = "com.example.app";
    request.persona = 501;
    request.plugin = true;
    request.groups = {"group.a", "group.b"};
    request.systemGroups = {"systemgroup.c"};
    std::vector<uint8_t> data = upcall::encodeRequest(request);
    sb_packbuff* pb = sb_packbuff_init_with_buffer(data.data(), data.size(), true, 0);
    ASSERT_TRUE(pb);
    std::vector<std::string> items;
    uint16_t type = 0;
    while (sb_packbuff_get_item_value_type(pb, &type)) {
        int error = 0;
        if (type == 3 || type == 5) {
            items.push_back(std::to_string(type) + "=" +
                            std::to_string(sb_packbuff_unpack_uint32(pb, &error)));
        } else {
            const char* text = sb_packbuff_unpack_string(pb, nullptr, &error);
            items.push_back(std::to_string(type) + "=" + (text ? text : ""));
        }
        ASSERT_EQ(error, 0) << type;
    }
    sb_packbuff_free(pb);
    // The empty container and system container identifiers are left out.
    EXPECT_EQ(items, (std::vector<std::string>{"0=com.example.app", "3=501", "5=1", "4=group.a",
                                               "4=group.b", "7=systemgroup.c"}));
}

TEST(BerthctlUpcallTest, AReplyIsReadItemByItem) {
    std::string why;
    const auto reply = upcall::decodeReply(
        packed([](sb_packbuff* pb) {
            str(pb, 100, "/home");
            str(pb, 1, "/data");
            str(pb, 2, "/data/tmp");
            sb_packbuff_pack_key_with_string_value(pb, 3, "group.a", 4, "/groups/a");
            str(pb, 101, "/system");
            sb_packbuff_pack_key_with_string_value(pb, 102, "systemgroup.b", 103, "/sg/b");
            sb_packbuff_pack_uint32(pb, 0, 1);
        }),
        &why);
    ASSERT_TRUE(reply) << why;
    EXPECT_EQ(reply->home, "/home");
    EXPECT_EQ(reply->dataContainer, "/data");
    EXPECT_EQ(reply->tmp, "/data/tmp");
    EXPECT_EQ(reply->groups, (decltype(reply->groups){{"group.a", "/groups/a"}}));
    EXPECT_EQ(reply->systemContainer, "/system");
    EXPECT_EQ(reply->systemGroups, (decltype(reply->groups){{"systemgroup.b", "/sg/b"}}));
    EXPECT_TRUE(reply->success);

    const auto failed = upcall::decodeReply(
        packed([](sb_packbuff* pb) { sb_packbuff_pack_uint32(pb, 0, 0); }), &why);
    ASSERT_TRUE(failed) << why;
    EXPECT_FALSE(failed->success);
    EXPECT_FALSE(failed->home);
}

TEST(BerthctlUpcallTest, MalformedRepliesAreRefusedWithTheReason) {
    const struct {
        const char* name;
        std::function<void(sb_packbuff*)> fill;
        const char* reason;
    } cases[] = {
        {"no success item", [](sb_packbuff* pb) { str(pb, 100, "/home"); }, "no success item"},
        {"item after success",
         [](sb_packbuff* pb) {
             sb_packbuff_pack_uint32(pb, 0, 1);
             str(pb, 100, "/home");
         },
         "after the success item"},
        {"group without path",
         [](sb_packbuff* pb) {
             str(pb, 3, "group.a");
             sb_packbuff_pack_uint32(pb, 0, 1);
         },
         "has no path after it"},
        {"unknown type", [](sb_packbuff* pb) { str(pb, 7, "x"); }, "value type 7"},
        {"path as number", [](sb_packbuff* pb) { sb_packbuff_pack_uint32(pb, 1, 5); },
         "is not a string"},
        {"success as string", [](sb_packbuff* pb) { str(pb, 0, "1"); }, "not a number"},
    };
    for (const auto& c : cases) {
        std::string why;
        EXPECT_FALSE(upcall::decodeReply(packed(c.fill), &why)) << c.name;
        EXPECT_NE(why.find(c.reason), std::string::npos) << c.name << ": " << why;
    }
    std::string why;
    EXPECT_FALSE(upcall::decodeReply({1, 2, 3}, &why));
}

TEST(BerthctlUpcallTest, ADaemonThatNeverAnswersTimesOut) {
    char directory[] = "/tmp/berth-upcall.XXXXXX";
    ASSERT_TRUE(mkdtemp(directory));
    const std::string path = std::string(directory) + "/socket";
    const int listener = ::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
    struct sockaddr_un address {};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    ASSERT_EQ(::bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(listener, 1), 0);

    upcall::CallFailure failure;
    const auto started = std::chrono::steady_clock::now();
    EXPECT_FALSE(upcall::call({}, path, &failure, std::chrono::milliseconds(200)));
    EXPECT_GE(std::chrono::steady_clock::now() - started, std::chrono::milliseconds(200));
    EXPECT_EQ(failure.stage, upcall::CallFailure::Stage::Exchange);
    EXPECT_EQ(failure.error, ETIMEDOUT);
    ::close(listener);
    ::unlink(path.c_str());
    ::rmdir(directory);
}

}  // namespace
}  // namespace berth

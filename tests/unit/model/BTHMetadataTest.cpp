#include "BTHMetadata.h"

#include <csignal>

#include "BTHPropertyListFile.h"
#include "TestSupport.h"
#include "platform/PropertyList.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

constexpr const char* kReadName =
    "+[BTHMetadata readAndValidateMetadataAtUrl:forUser:checkClassPath:error:]";
constexpr const char* kWriteName = "-[BTHMetadata writeMetadataToDiskWithError:]";
const Uuid kUuid = *Uuid::parse("1b4e28ba-2fa1-11d2-883f-0016d3cca427");

// A container tree in a scratch directory: <scratch>/Containers/<class>/<UUID>.
class BTHMetadataTest : public ::testing::Test {
  protected:
    fs::path makeContainer(const std::string& className) {
        fs::path url = scratch_.path() / "Containers" / className / Uuid::random().string();
        fs::create_directories(url);
        return url;
    }

    // The file of a valid per-user data container of user 501.
    static Value validFile() {
        return dict({{kBTHMetadataIdentifierKey, "com.example.app"},
                     {kBTHMetadataUUIDKey, kUuid.string()},
                     {kBTHMetadataContentClassKey, uint64_t{2}},
                     {kBTHMetadataPersonaKey, uint32_t{501}}});
    }

    static void writeMetadata(const fs::path& container, const Value& dict) {
        BTHErrorRef error;
        ASSERT_TRUE(BTH_writeToURL(dict, BTHMetadata::metadataFileURL(container),
                                   kBTHStateFileWriteOptions, &error))
            << (error ? error->description() : "");
    }

    static Value storedFile(const fs::path& container) {
        std::optional<Value> dict = BTH_dictionaryWithContentsOfURL(
            BTHMetadata::metadataFileURL(container), BTHReadImmutable, nullptr);
        return dict ? *dict : Value();
    }

    // Reads and expects failure with `code` and `message`, made and logged
    // once under the read's own name.
    static void expectReadFailure(const fs::path& container, uid_t user, bool checkClassPath,
                                  int32_t code, const std::string& message) {
        LogCapture log;
        BTHErrorRef error;
        EXPECT_EQ(
            BTHMetadata::readAndValidateMetadataAtUrl(container, user, checkClassPath, &error),
            nullptr);
        ASSERT_NE(error, nullptr);
        EXPECT_TRUE(error->isBTHError(code)) << error->description();
        EXPECT_EQ(error->localizedDescription(), message);
        EXPECT_EQ(error->functionName(), kReadName);
        auto lines = log.lines();
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].level, BTHLogLevelError);
        EXPECT_EQ(lines[0].function, kReadName);
        EXPECT_NE(lines[0].message.find(message), std::string::npos) << lines[0].message;
    }

    ScratchDir scratch_;
};

TEST_F(BTHMetadataTest, WriteThenReadGivesTheSameRecordWithExactlyTheDefinedKeys) {
    const fs::path url = makeContainer("Data/Application");
    const Value info =
        dict({{"sys.kelp.Lading.ContentProtectionClass", int32_t{3}},
              {"nested",
               dict({{"list", Value(Value::Array{Value(int64_t{-3}), Value("x"), Value(true)})},
                     {"blob", Value(Value::Data{0, 1, 0xff})}})}});
    BTHMetadata written(501, kUuid, 2, "com.example.app", info, url, "Assets");
    ASSERT_TRUE(written.writeMetadataToDisk(nullptr));

    std::shared_ptr<BTHMetadata> read =
        BTHMetadata::readAndValidateMetadataAtUrl(url, 501, true, nullptr);
    ASSERT_NE(read, nullptr);
    EXPECT_EQ(*read, written);

    EXPECT_EQ(readFile(BTHMetadata::metadataFileURL(url)).substr(0, 8), "bplist00");
    Value expected = validFile();  // its UUID string is upper-case
    expected.set(kBTHMetadataInfoKey, info);
    expected.set(kBTHMetadataUserManagedAssetsDirNameKey, "Assets");
    EXPECT_EQ(storedFile(url), expected);

    // Without info and assets name those keys are left out, not written empty.
    BTHMetadata bare(33, kUuid, 1, "com.example.app", std::nullopt, url, std::nullopt);
    ASSERT_TRUE(bare.writeMetadataToDisk(nullptr));
    expected = validFile();
    expected.set(kBTHMetadataContentClassKey, uint64_t{1});
    expected.set(kBTHMetadataPersonaKey, uint32_t{33});
    EXPECT_EQ(storedFile(url), expected);
    read = BTHMetadata::readAndValidateMetadataAtUrl(url, 33, false, nullptr);
    ASSERT_NE(read, nullptr);
    EXPECT_EQ(*read, bare);
}

// The wrong types of each key are in the ordering test below.
TEST_F(BTHMetadataTest, InvalidValuesFailWithTheirOwnMessages) {
    const fs::path url = makeContainer("Data/Application");
    const std::string at = " at " + url.string();
    struct Case {
        const char* key;
        Value value;  // null: the key is removed
        std::string message;
    };
    const Case cases[] = {
        {kBTHMetadataIdentifierKey, Value(), "Invalid metadata Identifier: (null)" + at},
        {kBTHMetadataUUIDKey, Value(), "Invalid metadata UUID String: (null)" + at},
        {kBTHMetadataUUIDKey, Value("1B4E28BA2FA111D2883F0016D3CCA427"),
         "Invalid metadata UUID: (null)" + at},
        {kBTHMetadataContentClassKey, Value(true), "Invalid metadata Class: 1" + at},
        {kBTHMetadataContentClassKey, Value(uint64_t{0}), "Invalid metadata Content Class: 0" + at},
        {kBTHMetadataContentClassKey, Value(uint64_t{14}),
         "Invalid metadata Content Class: 14" + at},
        {kBTHMetadataContentClassKey, Value(int64_t{-1}),
         "Invalid metadata Content Class: -1" + at},
        {kBTHMetadataPersonaKey, Value(uint64_t{502}),
         "Incorrect UserId: 502, expecting: 501 for com.example.app" + at},
        {kBTHMetadataPersonaKey, Value("501"),
         "Incorrect UserId: 501, expecting: 501 for com.example.app" + at},
        // Not read modulo 2^32.
        {kBTHMetadataPersonaKey, Value(uint64_t{0x100000000} + 501),
         "Incorrect UserId: 4294967797, expecting: 501 for com.example.app" + at},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.message);
        Value dict = validFile();
        if (c.value.isNull())
            dict.erase(c.key);
        else
            dict.set(c.key, c.value);
        writeMetadata(url, dict);
        expectReadFailure(url, 501, true, BTHErrorMetadataInvalid, c.message);
    }
}

TEST_F(BTHMetadataTest, AFileWrongInSeveralWaysReportsTheEarliestCheck) {
    // Placed in the wrong class directory as well, so every check fails.
    const fs::path url = makeContainer("Data/SprocketPlugin");
    const std::string at = " at " + url.string();
    struct Step {
        const char* key;
        Value bad;
        Value good;
        std::string message;
    };
    const Step steps[] = {
        {kBTHMetadataIdentifierKey, Value(int64_t{1}), Value("com.example.app"),
         "Invalid metadata Identifier: 1" + at},
        {kBTHMetadataUUIDKey, Value(int64_t{2}), Value(kUuid.string()),
         "Invalid metadata UUID String: 2" + at},
        {kBTHMetadataContentClassKey, Value("c"), Value(uint64_t{2}),
         "Invalid metadata Class: c" + at},
        {kBTHMetadataPersonaKey, Value(uint64_t{7}), Value(uint64_t{501}),
         "Incorrect UserId: 7, expecting: 501 for com.example.app" + at},
        {kBTHMetadataInfoKey, Value(int64_t{3}), Value::dictionary(),
         "Invalid metadata Info: 3" + at},
        {kBTHMetadataUserManagedAssetsDirNameKey, Value(int64_t{4}), Value("Assets"),
         "Invalid metadata User Managed Dir Name String: 4" + at},
    };
    Value dict = validFile();
    for (const Step& s : steps) dict.set(s.key, s.bad);
    for (const Step& s : steps) {
        SCOPED_TRACE(s.message);
        writeMetadata(url, dict);
        expectReadFailure(url, 501, true, BTHErrorMetadataInvalid, s.message);
        dict.set(s.key, s.good);
    }
    writeMetadata(url, dict);
    expectReadFailure(url, 501, true, BTHErrorMetadataInvalid,
                      "Invalid metadata-URLs should match: " + url.string() + " : " +
                          (scratch_.path() / "Containers/Data/Application").string());
    EXPECT_NE(BTHMetadata::readAndValidateMetadataAtUrl(url, 501, false, nullptr), nullptr);
}

TEST_F(BTHMetadataTest, UnreadableFilesFailWithTheReadError) {
    const fs::path url = makeContainer("Data/Application");
    const std::string message = "Failed to read metadata at URL " + url.string();
    const fs::path file = BTHMetadata::metadataFileURL(url);

    expectReadFailure(url, 501, true, BTHErrorMetadataReadFailed, message);  // no file

    const std::optional<std::vector<uint8_t>> array =
        plist::serializeBinary(Value(Value::Array{validFile()}));
    ASSERT_TRUE(array);
    writeFile(file, std::string(array->begin(), array->end()));
    expectReadFailure(url, 501, true, BTHErrorMetadataReadFailed, message);

    writeFile(file, "bplist00 this is not a property list");
    expectReadFailure(url, 501, true, BTHErrorMetadataReadFailed, message);

    fs::remove(file);
    fs::create_directory(file);
    expectReadFailure(url, 501, true, BTHErrorMetadataReadFailed, message);
}

TEST_F(BTHMetadataTest, APipeInTheFilesPlaceDoesNotBlockTheReader) {
    // An app can put a pipe where its container's file belongs: the read must
    // fail at once, not wait for a writer. A stuck child is ended by its alarm.
    const fs::path url = makeContainer("Data/Application");
    ASSERT_EQ(::mkfifo(BTHMetadata::metadataFileURL(url).c_str(), 0644), 0);
    const int status = inChild([&] {
        ::alarm(10);
        BTHErrorRef error;
        return !BTHMetadata::readAndValidateMetadataAtUrl(url, 501, true, &error) && error &&
                       error->isBTHError(BTHErrorMetadataReadFailed)
                   ? 0
                   : 1;
    });
    EXPECT_NE(status, 128 + SIGALRM) << "the reader blocked opening a pipe";
    EXPECT_EQ(status, 0);
}

TEST_F(BTHMetadataTest, SymbolicLinksAreNeverFollowed) {
    // A valid file elsewhere, reached through a link in the metadata file's
    // place or in the container's path, must not be read.
    const fs::path real = makeContainer("Data/Application");
    writeMetadata(real, validFile());
    ASSERT_NE(BTHMetadata::readAndValidateMetadataAtUrl(real, 501, true, nullptr), nullptr);

    const fs::path linkedFile = makeContainer("Data/Application");
    fs::create_symlink(BTHMetadata::metadataFileURL(real),
                       BTHMetadata::metadataFileURL(linkedFile));
    const fs::path linkedContainer = real.parent_path() / Uuid::random().string();
    fs::create_directory_symlink(real, linkedContainer);
    fs::create_directory_symlink(scratch_.path() / "Containers", scratch_.path() / "Linked");
    const fs::path linkedParent = scratch_.path() / "Linked/Data/Application" / real.filename();
    for (const fs::path& url : {linkedFile, linkedContainer, linkedParent})
        expectReadFailure(url, 501, true, BTHErrorMetadataReadFailed,
                          "Failed to read metadata at URL " + url.string());
}

TEST_F(BTHMetadataTest, AMissingUserIsDefaultedForThisReadOnly) {
    const fs::path data = makeContainer("Data/Application");
    Value dict = validFile();
    dict.erase(kBTHMetadataPersonaKey);
    writeMetadata(data, dict);
    for (uid_t user : {501u, 502u}) {
        std::shared_ptr<BTHMetadata> read =
            BTHMetadata::readAndValidateMetadataAtUrl(data, user, true, nullptr);
        ASSERT_NE(read, nullptr) << user;
        EXPECT_EQ(read->uid(), user);
    }
    EXPECT_EQ(storedFile(data).find(kBTHMetadataPersonaKey), nullptr) << "written back";

    const fs::path bundle = makeContainer("Bundle/Application");
    dict.set(kBTHMetadataContentClassKey, uint64_t{1});
    writeMetadata(bundle, dict);
    std::shared_ptr<BTHMetadata> read =
        BTHMetadata::readAndValidateMetadataAtUrl(bundle, 33, true, nullptr);
    ASSERT_NE(read, nullptr);
    EXPECT_EQ(read->uid(), 33u);

    dict.set(kBTHMetadataPersonaKey, uint32_t{501});
    writeMetadata(bundle, dict);
    expectReadFailure(
        bundle, 33, true, BTHErrorMetadataInvalid,
        "Incorrect UserId: 501, expecting: 33 for com.example.app at " + bundle.string());
}

TEST_F(BTHMetadataTest, TheClassPathIsComparedAsPathStrings) {
    const fs::path url = makeContainer("Data/Application");
    writeMetadata(url, validFile());
    // A trailing slash names the same container.
    fs::path slashed = url.string() + "/";
    EXPECT_NE(BTHMetadata::readAndValidateMetadataAtUrl(slashed, 501, true, nullptr), nullptr);

    // A container made inside another container is not in a class directory.
    const fs::path nested = url / Uuid::random().string();
    fs::create_directory(nested);
    writeMetadata(nested, validFile());
    expectReadFailure(nested, 501, true, BTHErrorMetadataInvalid,
                      "Invalid metadata-URLs should match: " + nested.string() + " : " +
                          (scratch_.path() / "Containers/Data/Data/Application").string());
}

TEST_F(BTHMetadataTest, XMLFilesAreReadLikeBinaryOnes) {
    const fs::path url = makeContainer("Data/Application");
    writeFile(BTHMetadata::metadataFileURL(url), R"(<?xml version="1.0" encoding="UTF-8"?>
<!DOCTYPE plist>
<plist version="1.0">
<dict>
    <key>BTHMetadataContentClass</key><integer>2</integer>
    <key>BTHMetadataIdentifier</key><string>com.example.app</string>
    <key>BTHMetadataInfo</key><dict><key>k</key><array><true/><integer>-4</integer></array></dict>
    <key>BTHMetadataPersona</key><integer>501</integer>
    <key>BTHMetadataUUID</key><string>1b4e28ba-2fa1-11d2-883f-0016d3cca427</string>
    <key>Unknown</key><string>ignored</string>
</dict>
</plist>
)");
    std::shared_ptr<BTHMetadata> read =
        BTHMetadata::readAndValidateMetadataAtUrl(url, 501, true, nullptr);
    ASSERT_NE(read, nullptr);
    const Value info = dict({{"k", Value(Value::Array{Value(true), Value(int64_t{-4})})}});
    EXPECT_EQ(*read, BTHMetadata(501, kUuid, 2, "com.example.app", info, url, std::nullopt));
}

TEST_F(BTHMetadataTest, AFailedWriteIsReportedAndLeavesNoFile) {
    const fs::path missing = scratch_.path() / "Containers/Data/Application/Missing";
    BTHMetadata record(501, kUuid, 2, "com.example.app", std::nullopt, missing, std::nullopt);
    LogCapture log;
    BTHErrorRef error;
    EXPECT_FALSE(record.writeMetadataToDisk(&error));
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->isBTHError(BTHErrorWriteFailed));
    EXPECT_EQ(error->localizedDescription(),
              "Failed to write metadata dictionary to URL " + missing.string());
    EXPECT_EQ(error->functionName(), kWriteName);
    ASSERT_NE(error->underlyingError(), nullptr);
    EXPECT_TRUE(error->underlyingError()->isPOSIXError(ENOENT));
    EXPECT_EQ(log.count(BTHLogLevelError, "Failed to write metadata dictionary to URL"), 1u);
    EXPECT_FALSE(fs::exists(missing));

    // A record that cannot be serialised keeps the old file whole.
    const fs::path url = makeContainer("Data/Application");
    record.setUrl(url);
    ASSERT_TRUE(record.writeMetadataToDisk(nullptr));
    record.setInfo(dict({{"id", Uuid::random()}}));
    error.reset();
    EXPECT_FALSE(record.writeMetadataToDisk(&error));
    EXPECT_TRUE(error && error->isBTHError(BTHErrorWriteFailed) && error->underlyingError());
    EXPECT_EQ(storedFile(url), validFile());
    EXPECT_EQ(std::distance(fs::directory_iterator(url), fs::directory_iterator()), 1);
}

}  // namespace
}  // namespace berth

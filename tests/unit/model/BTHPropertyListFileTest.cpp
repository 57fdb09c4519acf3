#include "BTHPropertyListFile.h"

#include <fcntl.h>

#include "TestSupport.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace test;
const auto entries = namesIn;

Value state(const char* identifier) {
    return dict({{"BTHMetadataIdentifier", identifier},
                 {"BTHMetadataContentClass", uint64_t{2}},
                 {"BTHMetadataPersona", uint32_t{501}}});
}

bool isGeneralCorrupt(const BTHErrorRef& e) {
    return e && e->domain() == kBTHGeneralErrorDomain && e->code() == 2048;
}

std::optional<Value> read(const stdfs::path& path, BTHErrorRef* error) {
    return BTH_dictionaryWithContentsOfURL(path, BTHReadMutableContainers, error);
}

TEST(BTHPropertyListFileTest, AtomicWriteReplacesTheFileWholeAndLeavesNothingBehind) {
    ScratchDir dir;
    const stdfs::path file = dir / "state.plist";
    BTHErrorRef error;
    ASSERT_TRUE(BTH_writeToURL(state("one"), file, kBTHStateFileWriteOptions, &error));
    EXPECT_EQ(readFile(file).substr(0, 8), "bplist00");

    // A reader that opened the old file keeps seeing it whole: the new one
    // is renamed over it, never written into it.
    const std::string before = readFile(file);
    UniqueFd old(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_TRUE(BTH_writeToURL(state("two"), file, kBTHStateFileWriteOptions, &error));
    std::string seen(before.size(), '\0');
    EXPECT_EQ(::pread(old.get(), seen.data(), seen.size(), 0), ssize_t(before.size()));
    EXPECT_EQ(seen, before);

    EXPECT_EQ(*read(file, &error), state("two"));
    EXPECT_EQ(entries(dir.path()), std::set<std::string>{"state.plist"});
}

TEST(BTHPropertyListFileTest, FailedWritesKeepTheOldFileAndRemoveTheirTemporary) {
    ScratchDir dir;
    // The rename fails when a directory holds the name: the temporary file
    // was already written and must go again.
    stdfs::create_directory(dir / "busy");
    writeFile(dir / "busy" / "inside", "x");
    BTHErrorRef error;
    EXPECT_FALSE(BTH_writeToURL(state("a"), dir / "busy", kBTHStateFileWriteOptions, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), kBTHPOSIXErrorDomain);
    EXPECT_EQ(entries(dir.path()), std::set<std::string>{"busy"});

    // A value with no property-list form writes nothing.
    Value withNull = state("a");
    withNull.set("n", nullptr);
    error.reset();
    EXPECT_FALSE(BTH_writeToURL(withNull, dir / "new.plist", kBTHStateFileWriteOptions, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), kBTHGeneralErrorDomain);
    EXPECT_EQ(error->code(), kBTHPropertyListWriteInvalidError);
    EXPECT_FALSE(stdfs::exists(dir / "new.plist"));
}

TEST(BTHPropertyListFileTest, WriteIntoAnUnwritableDirectoryKeepsTheOldFile) {
    BERTH_REQUIRE_ROOT();  // root ignores modes; only the immutable flag stops it
    ScratchDir dir;
    const stdfs::path file = dir / "state.plist";
    ASSERT_TRUE(BTH_writeToURL(state("old"), file, kBTHStateFileWriteOptions, nullptr));
    ASSERT_TRUE(setImmutable(dir.path(), true));
    BTHErrorRef error;
    const bool wrote = BTH_writeToURL(state("new"), file, kBTHStateFileWriteOptions, &error);
    setImmutable(dir.path(), false);
    EXPECT_FALSE(wrote);
    expectPOSIXError(error, EPERM);
    EXPECT_EQ(*read(file, nullptr), state("old"));
    EXPECT_EQ(entries(dir.path()), std::set<std::string>{"state.plist"});
}

TEST(BTHPropertyListFileTest, SymbolicLinksAreNeverFollowed) {
    ScratchDir dir;
    stdfs::create_directory(dir / "real");
    stdfs::create_directory_symlink(dir / "real", dir / "linked");
    const stdfs::path target = dir / "real" / "state.plist";
    ASSERT_TRUE(BTH_writeToURL(state("target"), target, kBTHStateFileWriteOptions, nullptr));
    const std::string original = readFile(target);

    // A linked directory refuses both reading and writing.
    BTHErrorRef error;
    EXPECT_FALSE(BTH_writeToURL(state("evil"), dir / "linked" / "other.plist",
                                kBTHStateFileWriteOptions, &error));
    ASSERT_TRUE(error);
    // Opening a linked directory without following it fails with ENOTDIR.
    EXPECT_TRUE(error->isPOSIXError(ELOOP) || error->isPOSIXError(ENOTDIR)) << error->description();
    EXPECT_FALSE(stdfs::exists(dir / "real" / "other.plist"));
    error.reset();
    EXPECT_FALSE(read(dir / "linked" / "state.plist", &error));
    expectPOSIXError(error, ELOOP);

    // A link in the file's place is not read through; a write replaces the
    // link itself and leaves its target alone.
    stdfs::create_symlink(target, dir / "link.plist");
    error.reset();
    EXPECT_FALSE(read(dir / "link.plist", &error));
    expectPOSIXError(error, ELOOP);
    ASSERT_TRUE(
        BTH_writeToURL(state("mine"), dir / "link.plist", kBTHStateFileWriteOptions, nullptr));
    EXPECT_FALSE(stdfs::is_symlink(dir / "link.plist"));
    EXPECT_EQ(readFile(target), original);
}

TEST(BTHPropertyListFileTest, ReadGivesTheReadErrorOrTheFormatError) {
    ScratchDir dir;
    BTHErrorRef error;
    EXPECT_FALSE(read(dir / "missing.plist", &error));
    expectPOSIXError(error, ENOENT);

    writeFile(dir / "state.xml",
              "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
              "<key>BTHMetadataIdentifier</key><string>one</string>"
              "<key>BTHMetadataContentClass</key><integer>2</integer>"
              "<key>BTHMetadataPersona</key><integer>501</integer></dict></plist>");
    std::optional<Value> xml = read(dir / "state.xml", &error);
    ASSERT_TRUE(xml);
    EXPECT_EQ(*xml, state("one"));

    std::string deep = "<plist>";
    for (int i = 0; i < 100000; ++i) deep += "<array>";
    writeFile(dir / "deep.plist", deep);
    writeFile(dir / "array.plist", "<plist><array><string>a</string></array></plist>");
    writeFile(dir / "garbage.plist", "bplist00 not really");
    {
        UniqueFd big(::open((dir / "big.plist").c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
        ASSERT_EQ(::ftruncate(big.get(), 33 << 20), 0);  // sparse; refused before reading
    }
    // An app may leave a FIFO (or a directory) where a state file should be:
    // refused at once, never waited on.
    ASSERT_EQ(::mkfifo((dir / "fifo.plist").c_str(), 0644), 0);
    stdfs::create_directory(dir / "dir.plist");
    for (const char* name :
         {"deep.plist", "array.plist", "garbage.plist", "big.plist", "fifo.plist", "dir.plist"}) {
        error.reset();
        EXPECT_FALSE(read(dir / name, &error)) << name;
        EXPECT_TRUE(isGeneralCorrupt(error))
            << name << ": " << (error ? error->description() : "no error");
    }
}

}  // namespace
}  // namespace berth

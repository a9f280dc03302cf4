#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/Storage.h"
#include "tests/support/BundleFixture.h"

using om::Storage;

namespace {

std::string contentsOf(const std::string& path)
{
    std::ifstream file(path);
    std::stringstream text;
    text << file.rdbuf();
    return text.str();
}

std::span<const uint8_t> bytesOf(std::string_view text)
{
    return { reinterpret_cast<const uint8_t*>(text.data()), text.size() };
}

} // namespace

TEST(Storage, SafeComponentsNameExactlyOneEntry)
{
    const struct {
        std::string text;
        bool safe;
    } cases[] = {
        { "com.orvex.notes", true },
        { "..hidden", true },
        { std::string(255, 'a'), true },
        { std::string(256, 'a'), false },
        { "", false },
        { ".", false },
        { "..", false },
        { "a/b", false },
        { "../../etc", false },
        { std::string("a\0b", 3), false },
    };
    for (const auto& test : cases)
        EXPECT_EQ(Storage::isSafeComponent(test.text), test.safe) << test.text;
}

TEST(Storage, AtomicWriteReplacesWholeAndLeavesNothingBehind)
{
    om::test::BundleFixture fixture;
    const std::string path = fixture.root() + "/state/db.vlist";
    ASSERT_TRUE(Storage::makeDirectories(fixture.root() + "/state").ok());

    ASSERT_TRUE(Storage::writeFileAtomically(path, bytesOf("first"), 0600).ok());
    ASSERT_TRUE(Storage::writeFileAtomically(path, bytesOf("second, longer"), 0600).ok());

    EXPECT_EQ(contentsOf(path), "second, longer");
    struct stat info;
    ASSERT_EQ(::stat(path.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0077, 0u);
    size_t entries = 0;
    for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(fixture.root() + "/state"))
        ++entries;
    EXPECT_EQ(entries, 1u);
}

// A rename that fails (here: onto a directory that is not empty, which root cannot do either)
// must leave what was there and take its temporary file away.
TEST(Storage, AFailedWriteKeepsWhatWasThereAndCleansUp)
{
    om::test::BundleFixture fixture;
    const std::string path = fixture.makeDirectory("state/db.vlist");
    fixture.writeFile("state/db.vlist/keep", "old");

    auto written = Storage::writeFileAtomically(path, bytesOf("new"));

    ASSERT_FALSE(written.ok());
    EXPECT_NE(written.error().localizedDescription().find("rename"), std::string::npos);
    EXPECT_EQ(contentsOf(path + "/keep"), "old");
    size_t entries = 0;
    for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(fixture.root() + "/state"))
        ++entries;
    EXPECT_EQ(entries, 1u);
}

TEST(Storage, KeepingWriteNeverReplacesAndLeavesNothingBehind)
{
    om::test::BundleFixture fixture;
    const std::string path = fixture.root() + "/key";

    ASSERT_TRUE(Storage::writeFileAtomically(path, bytesOf("first"), 0600, Storage::Existing::Keep).ok());
    auto second = Storage::writeFileAtomically(path, bytesOf("second"), 0600, Storage::Existing::Keep);

    ASSERT_FALSE(second.ok());
    EXPECT_EQ(second.error().code(), EEXIST);
    EXPECT_EQ(contentsOf(path), "first");
    size_t entries = 0;
    for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(fixture.root()))
        ++entries;
    EXPECT_EQ(entries, 1u);
}

TEST(Storage, AtomicWriteTakesTheLongestFileName)
{
    om::test::BundleFixture fixture;
    for (const size_t length : { size_t(255), size_t(256) }) {
        const std::string path = fixture.root() + "/" + std::string(length, 'n');
        EXPECT_EQ(Storage::writeFileAtomically(path, bytesOf("contents")).ok(), length <= 255) << length;
    }
    EXPECT_EQ(contentsOf(fixture.root() + "/" + std::string(255, 'n')), "contents");
}

// The limit holds in pairs, and what is no regular file fails at once: a FIFO with no writer
// would otherwise block the reader for good.
TEST(Storage, ReadFileTakesRegularFilesUpToTheLimitOnly)
{
    om::test::BundleFixture fixture;
    const std::string path = fixture.writeFile("file", "0123456789");
    auto whole = Storage::readFile(path, 10);
    ASSERT_TRUE(whole.ok());
    EXPECT_EQ(std::string(whole->begin(), whole->end()), "0123456789");
    auto over = Storage::readFile(path, 9);
    ASSERT_FALSE(over.ok());
    EXPECT_EQ(over.error().code(), om::kPlatformErrorLimit);

    const std::string fifo = fixture.root() + "/fifo";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    for (const std::string& other : { fifo, fixture.root(), std::string("/dev/zero") }) {
        auto read = Storage::readFile(other, 1 << 20);
        ASSERT_FALSE(read.ok()) << other;
        EXPECT_EQ(read.error().code(), om::kPlatformErrorUnsupported) << other;
    }
}

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <filesystem>
#include <latch>
#include <thread>
#include <vector>

#include "platform/Sandbox.h"
#include "platform/UniqueFd.h"
#include "tests/support/BundleFixture.h"

using om::Sandbox;
using om::test::BundleFixture;

namespace {

constexpr auto kReadOnly = Sandbox::kReadOnlyFileClass;
namespace fs = std::filesystem;

// Every test works under a key of its own, made on first use in a directory that does not exist yet.
class SandboxTest : public ::testing::Test {
protected:
    void SetUp() override { useKey(m_keyPath); }
    void TearDown() override { ::unsetenv("SANDBOX_KEY"); }

    static void useKey(const std::string& path) { ::setenv("SANDBOX_KEY", path.c_str(), 1); }

    // A token that verifies now, so that a later refusal is the doing of what changed since.
    static std::string issue(const std::string& path)
    {
        auto token = Sandbox::issueFileExtension(kReadOnly, path, Sandbox::kCanonicalPath);
        EXPECT_TRUE(token.ok() && Sandbox::verify(*token).ok()) << path;
        return token.ok() ? *token : std::string();
    }

    BundleFixture m_fixture;
    std::string m_keyPath = m_fixture.root() + "/keys/nested/sandbox.key";
};

// class, time, mac, path
std::vector<std::string> fieldsOf(std::string token)
{
    std::vector<std::string> fields;
    for (size_t end; fields.size() < 3 && (end = token.find(';')) != std::string::npos; token.erase(0, end + 1))
        fields.push_back(token.substr(0, end));
    fields.push_back(token);
    return fields;
}

bool isOpen(int64_t handle)
{
    return ::fcntl(static_cast<int>(handle), F_GETFD) >= 0;
}

struct stat statOf(int64_t handle)
{
    struct stat info { };
    EXPECT_EQ(::fstat(static_cast<int>(handle), &info), 0);
    return info;
}

} // namespace

TEST_F(SandboxTest, TokenNamesClassTimeMacAndCanonicalPath)
{
    const std::string file = m_fixture.writeFile("Bundle.appex/Shared/data.txt", "shared");
    fs::create_symlink(m_fixture.root() + "/Bundle.appex", m_fixture.root() + "/link");

    const auto before = std::time(nullptr);
    const auto fields = fieldsOf(issue(m_fixture.root() + "/link/./Shared/../Shared/data.txt"));
    const auto after = std::time(nullptr);

    ASSERT_EQ(fields.size(), 4u);
    EXPECT_EQ(fields[0], kReadOnly);
    EXPECT_GE(std::stoll(fields[1]), before);
    EXPECT_LE(std::stoll(fields[1]), after);
    EXPECT_EQ(fields[2].size(), 64u);
    EXPECT_EQ(fields[2].find_first_not_of("0123456789abcdef"), std::string::npos);
    EXPECT_EQ(fields[3], file);
}

TEST_F(SandboxTest, ConsumeOpensReadOnlyAnewEachTimeAndReleaseCloses)
{
    const std::string file = m_fixture.writeFile("Bundle.appex/data.txt", "shared bytes");
    const std::string token = issue(file);

    const int64_t first = Sandbox::consume(token);
    const int64_t second = Sandbox::consume(token);
    const int64_t directory = Sandbox::consume(issue(m_fixture.root() + "/Bundle.appex"));

    ASSERT_GE(first, 3);
    ASSERT_GE(second, 3);
    ASSERT_GE(directory, 3);
    EXPECT_NE(first, second);
    struct stat info { };
    ASSERT_EQ(::stat(file.c_str(), &info), 0);
    EXPECT_EQ(statOf(first).st_ino, info.st_ino);
    EXPECT_EQ(statOf(second).st_ino, info.st_ino);
    EXPECT_TRUE(S_ISDIR(statOf(directory).st_mode));
    EXPECT_NE(::fcntl(static_cast<int>(first), F_GETFD) & FD_CLOEXEC, 0);
    const int status = ::fcntl(static_cast<int>(first), F_GETFL);
    EXPECT_EQ(status & (O_ACCMODE | O_NONBLOCK), O_RDONLY);
    char text[32] = {};
    EXPECT_EQ(::read(static_cast<int>(first), text, sizeof text), 12);
    EXPECT_STREQ(text, "shared bytes");

    Sandbox::release(first);
    EXPECT_FALSE(isOpen(first));
    EXPECT_TRUE(isOpen(second));
    Sandbox::release(second);
    Sandbox::release(directory);
    // Values consume never answers are left alone.
    for (int64_t handle : { int64_t(-1), int64_t(0), int64_t(1), int64_t(2), int64_t(1) << 40 })
        Sandbox::release(handle);
    EXPECT_TRUE(isOpen(0) && isOpen(1) && isOpen(2));
}

TEST_F(SandboxTest, HandleIsNeverAStandardStream)
{
    const std::string token = issue(m_fixture.writeFile("data.txt", "x"));
    // With descriptor 0 free, a plain open would answer 0.
    om::UniqueFd savedStdin(::fcntl(0, F_DUPFD_CLOEXEC, 3));
    ASSERT_TRUE(savedStdin.valid());
    ASSERT_EQ(::close(0), 0);

    const int64_t handle = Sandbox::consume(token);
    const bool zeroStillFree = !isOpen(0);
    ASSERT_EQ(::dup2(savedStdin.get(), 0), 0);

    EXPECT_GE(handle, 3);
    EXPECT_TRUE(zeroStillFree);
    Sandbox::release(handle);
}

TEST_F(SandboxTest, FifoOpensWithoutWaitingForAWriter)
{
    const std::string fifo = m_fixture.makeDirectory("Bundle.appex") + "/pipe";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);

    const int64_t handle = Sandbox::consume(issue(fifo));

    EXPECT_GE(handle, 3);
    Sandbox::release(handle);
}

TEST_F(SandboxTest, IssueRefusesWhatItCannotGrant)
{
    const std::string file = m_fixture.writeFile("data.txt", "x");
    const struct {
        std::string_view extensionClass;
        std::string path;
        uint32_t flags;
        int64_t code;
    } cases[] = {
        { kReadOnly, m_fixture.root() + "/missing/data.txt", Sandbox::kCanonicalPath, ENOENT },
        { kReadOnly, file + "/inner", Sandbox::kCanonicalPath, ENOTDIR },
        { kReadOnly, "", Sandbox::kCanonicalPath, ENOENT },
        { kReadOnly, "data.txt", 0, EINVAL },
        { kReadOnly, file + std::string("\0x", 2), Sandbox::kCanonicalPath, EINVAL },
        { "com.orvex.sandbox.read-write", file, Sandbox::kCanonicalPath, EINVAL },
        { kReadOnly, file, Sandbox::kCanonicalPath | 2, EINVAL },
    };
    for (const auto& test : cases) {
        auto token = Sandbox::issueFileExtension(test.extensionClass, test.path, test.flags);
        ASSERT_FALSE(token.ok()) << test.path;
        EXPECT_EQ(token.error(), om::OMError("POSIX", test.code, token.error().description())) << test.path;
    }
}

TEST_F(SandboxTest, ChangedOrMalformedTokensAreRefused)
{
    const std::string file = m_fixture.writeFile("a", "a");
    m_fixture.writeFile("b", "b");
    const auto fields = fieldsOf(issue(file));
    auto with = [&](size_t index, std::string value) {
        auto copy = fields;
        copy[index] = std::move(value);
        return copy[0] + ";" + copy[1] + ";" + copy[2] + ";" + copy[3];
    };
    std::string flipped = fields[2];
    flipped[0] = flipped[0] == '0' ? '1' : '0';
    std::string upper = fields[2];
    for (auto& c : upper)
        c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));

    for (const std::string& token :
        { with(0, "com.orvex.sandbox.read-write"), with(1, std::to_string(std::stoll(fields[1]) + 1)),
            with(1, "+" + fields[1]), with(1, ""), with(2, flipped), with(2, upper), with(2, fields[2].substr(1)),
            with(2, fields[2] + "0"), with(3, m_fixture.root() + "/b"), with(3, file + "/"), with(3, "a"),
            with(3, file + std::string(1, '\0')), fields[0] + ";" + fields[1] + ";" + fields[2], std::string(";;;") }) {
        EXPECT_FALSE(Sandbox::verify(token).ok()) << token;
        EXPECT_EQ(Sandbox::consume(token), -1) << token;
    }
}

TEST_F(SandboxTest, TokenOfAnotherKeyIsRefused)
{
    const std::string token = issue(m_fixture.writeFile("data.txt", "x"));

    useKey(m_fixture.root() + "/other.key");
    EXPECT_FALSE(Sandbox::verify(token).ok());
    EXPECT_EQ(Sandbox::consume(token), -1);
}

// The path was canonical when issued; a component replaced by a link later must not redirect it.
TEST_F(SandboxTest, LinkSwappedIntoThePathAfterIssueIsNotFollowed)
{
    const std::string secret = m_fixture.writeFile("elsewhere/Shared/data.txt", "secret");
    const std::string shared = m_fixture.root() + "/Bundle.appex/Shared";
    const std::string file = m_fixture.writeFile("Bundle.appex/Shared/data.txt", "shared");
    const std::string token = issue(file);

    fs::rename(shared, shared + ".old");
    fs::create_directory_symlink(m_fixture.root() + "/elsewhere/Shared", shared);
    EXPECT_EQ(Sandbox::consume(token), -1);

    fs::remove(shared);
    fs::rename(shared + ".old", shared);
    const int64_t restored = Sandbox::consume(token);
    EXPECT_GE(restored, 3);
    Sandbox::release(restored);

    fs::remove(file);
    fs::create_symlink(secret, file);
    EXPECT_EQ(Sandbox::consume(token), -1);
}

TEST_F(SandboxTest, FirstUseFromManyThreadsMakesOneOwnerOnlyKey)
{
    const std::string file = m_fixture.writeFile("data.txt", "x");
    constexpr int kThreads = 8;
    std::vector<std::string> tokens(kThreads);
    std::latch start(kThreads);
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
        threads.emplace_back([&, i] {
            start.arrive_and_wait();
            auto token = Sandbox::issueFileExtension(kReadOnly, file, Sandbox::kCanonicalPath);
            tokens[i] = token.ok() ? *token : std::string();
        });
    }
    for (auto& thread : threads)
        thread.join();

    for (const auto& token : tokens)
        EXPECT_TRUE(Sandbox::verify(token).ok()) << token;
    struct stat info { };
    ASSERT_EQ(::stat(m_keyPath.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0600u);
    EXPECT_EQ(info.st_size, 32);
    // Nothing but the key is left behind in its directory.
    EXPECT_EQ(std::distance(fs::directory_iterator(fs::path(m_keyPath).parent_path()), fs::directory_iterator()), 1);
}

TEST_F(SandboxTest, UnsafeKeyIsRefusedByName)
{
    const std::string token = issue(m_fixture.writeFile("data.txt", "x"));
    const std::string key = m_fixture.root() + "/unsafe.key";
    const struct {
        unsigned mode;
        size_t size;
        bool accepted;
    } cases[] = {
        { 0600, 32, true },
        { 0400, 32, true },
        { 0640, 32, false },
        { 0604, 32, false },
        { 0620, 32, false },
        { 0601, 32, false },
        { 0600, 31, false },
        { 0600, 33, false },
        { 0600, 0, false },
    };
    for (const auto& test : cases) {
        fs::remove(key);
        BundleFixture::writeFileAt(key, std::string(test.size, 'k'), test.mode);
        useKey(key);

        auto issued = Sandbox::issueFileExtension(kReadOnly, m_fixture.root() + "/data.txt", Sandbox::kCanonicalPath);

        EXPECT_EQ(issued.ok(), test.accepted) << std::oct << test.mode << " " << std::dec << test.size;
        if (!issued.ok()) {
            EXPECT_NE(issued.error().localizedDescription().find(key), std::string::npos);
            EXPECT_FALSE(Sandbox::verify(token).ok());
        }
    }
    const std::string fifo = m_fixture.root() + "/key-fifo";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    for (const std::string& notAFile : { m_fixture.makeDirectory("key-directory"), fifo }) {
        useKey(notAFile);
        auto issued = Sandbox::issueFileExtension(kReadOnly, fifo, Sandbox::kCanonicalPath);
        ASSERT_FALSE(issued.ok()) << notAFile;
        EXPECT_NE(issued.error().localizedDescription().find(notAFile), std::string::npos);
    }
}

TEST_F(SandboxTest, KeyOfAnotherUserIsRefused)
{
    if (::geteuid() != 0)
        GTEST_SKIP() << "giving a file to another user needs root";
    const std::string key = m_fixture.writeFile("foreign.key", std::string(32, 'k'), 0600);
    ASSERT_EQ(::chown(key.c_str(), 65534, 65534), 0);
    useKey(key);

    auto issued = Sandbox::issueFileExtension(kReadOnly, key, Sandbox::kCanonicalPath);

    ASSERT_FALSE(issued.ok());
    EXPECT_NE(issued.error().localizedDescription().find(key), std::string::npos);
}

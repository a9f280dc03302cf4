#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "platform/Log.h"
#include "platform/Preferences.h"
#include "platform/Storage.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"

using om::Log;
using om::LogLevel;
using om::Preferences;
using om::Value;

namespace {

constexpr const char* kDomain = "com.orvex.test.prefs";

class PreferencesTest : public ::testing::Test {
protected:
    std::string directory() const { return m_fixture.root() + "/prefs"; }
    std::string path(const std::string& domain = kDomain) const { return directory() + "/" + domain + ".vlist"; }

    // Replaces the domain's file as a new file (a new inode), as an editor or a tool would.
    void replace(const Value& contents, const std::string& domain = kDomain)
    {
        const std::string text = om::Vlist::writeXml(contents);
        ASSERT_TRUE(om::Storage::makeDirectories(directory()).ok());
        ASSERT_TRUE(om::Storage::writeFileAtomically(
            path(domain), std::span(reinterpret_cast<const uint8_t*>(text.data()), text.size()))
                        .ok());
    }
    void replaceText(std::string_view text, const std::string& domain = kDomain)
    {
        om::test::BundleFixture::writeFileAt(path(domain), text);
    }

    std::string contents() const
    {
        auto bytes = om::Storage::readFile(path(), Preferences::kMaxFileSize);
        return bytes.ok() ? std::string(bytes->begin(), bytes->end()) : std::string();
    }

    static size_t errorsLogged(const Log::Capture& capture)
    {
        size_t count = 0;
        for (const auto& record : capture.records())
            count += record.category == "prefs" && record.level == LogLevel::Error;
        return count;
    }

    static Value one(const char* key, Value value) { return Value::dictionary({ { key, std::move(value) } }); }

    om::test::BundleFixture m_fixture;
};

struct stat statOf(const std::string& path)
{
    struct stat info { };
    EXPECT_EQ(::stat(path.c_str(), &info), 0) << path;
    return info;
}

// Writes text over the file's bytes in place and puts its modification time back, so that only the
// change time and the contents tell this version from the one before.
void rewriteInPlaceKeepingTimes(const std::string& path, std::string_view text, const struct stat& before)
{
    const int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    // The change time moves in coarse clock ticks: repeat the write until it has moved, so the
    // test never depends on how fast it runs. Each round is a real rewrite; none waits.
    struct stat after { };
    for (int round = 0; round < 10'000'000; ++round) {
        ASSERT_EQ(::pwrite(fd, text.data(), text.size(), 0), ssize_t(text.size()));
        const timespec times[2] = { before.st_atim, before.st_mtim };
        ASSERT_EQ(::futimens(fd, times), 0);
        ASSERT_EQ(::fstat(fd, &after), 0);
        if (after.st_ctim.tv_sec != before.st_ctim.tv_sec || after.st_ctim.tv_nsec != before.st_ctim.tv_nsec)
            break;
    }
    ::close(fd);
    EXPECT_EQ(after.st_size, before.st_size);
    EXPECT_EQ(after.st_ino, before.st_ino);
    EXPECT_EQ(after.st_mtim.tv_nsec, before.st_mtim.tv_nsec);
}

} // namespace

TEST_F(PreferencesTest, AChangedFileIsReadAgainWhenSynchronised)
{
    Log::Capture capture;
    Preferences preferences(directory());
    ASSERT_TRUE(preferences.addSuiteNamed(kDomain).ok());
    EXPECT_TRUE(preferences.synchronizedValueForKey("key").isNone()); // no directory, no file

    replace(one("key", 1));
    EXPECT_EQ(preferences.synchronizedValueForKey("key"), Value(1));
    replace(one("key", 2));
    EXPECT_EQ(preferences.valueForKey("key"), Value(1)); // what was read, until synchronised
    EXPECT_EQ(preferences.synchronizedValueForKey("key"), Value(2));
    ASSERT_EQ(::unlink(path().c_str()), 0);
    EXPECT_TRUE(preferences.synchronizedValueForKey("key").isNone());
    EXPECT_EQ(errorsLogged(capture), 0u);
}

// Changes that a check of the modification time alone would miss: the same size, the same
// modification time, and a new inode or (in place) only a new change time.
TEST_F(PreferencesTest, ChangesWithinTheSameSecondAndSizeAreSeen)
{
    replaceText(om::Vlist::writeXml(one("key", "aaaa")));
    Preferences preferences(directory());
    ASSERT_TRUE(preferences.addSuiteNamed(kDomain).ok());
    ASSERT_EQ(preferences.synchronizedValueForKey("key"), Value("aaaa"));

    struct stat before = statOf(path());
    replace(one("key", "bbbb"));
    const timespec times[2] = { before.st_atim, before.st_mtim };
    ASSERT_EQ(::utimensat(AT_FDCWD, path().c_str(), times, 0), 0);
    ASSERT_EQ(statOf(path()).st_size, before.st_size);
    EXPECT_EQ(preferences.synchronizedValueForKey("key"), Value("bbbb")) << "new inode";

    before = statOf(path());
    rewriteInPlaceKeepingTimes(path(), om::Vlist::writeXml(one("key", "cccc")), before);
    EXPECT_EQ(preferences.synchronizedValueForKey("key"), Value("cccc")) << "new change time";
}

TEST_F(PreferencesTest, ADamagedFileIsEmptyAndLoggedOncePerVersion)
{
    const std::string tooLarge
        = "<?xml version=\"1.0\"?><vlist version=\"1\"><dict/></vlist>" + std::string(Preferences::kMaxFileSize, ' ');
    const struct {
        const char* name;
        std::function<void()> damage;
    } cases[] = {
        { "not a vlist", [this] { replaceText("this is not a vlist"); } },
        { "truncated XML", [this] { replaceText(om::Vlist::writeXml(one("key", 1)).substr(0, 60)); } },
        { "an array", [this] { replace(Value::array({ "key" })); } },
        { "binary junk", [this] { replaceText(std::string_view("vlst1\0\xff\xff", 8)); } },
        { "larger than the limit", [this, &tooLarge] { replaceText(tooLarge); } },
        { "a directory", [this] { m_fixture.makeDirectory("prefs/" + std::string(kDomain) + ".vlist"); } },
        { "a FIFO",
            [this] {
                m_fixture.makeDirectory("prefs");
                ASSERT_EQ(::mkfifo(path().c_str(), 0600), 0);
            } },
    };
    for (const auto& test : cases) {
        SCOPED_TRACE(test.name);
        std::error_code ignored;
        std::filesystem::remove_all(directory(), ignored);
        replace(one("key", "other domain"), "com.orvex.test.fallback");
        Log::Capture capture;
        Preferences preferences(directory());
        ASSERT_TRUE(preferences.addSuiteNamed(kDomain).ok());
        ASSERT_TRUE(preferences.addSuiteNamed("com.orvex.test.fallback").ok());

        test.damage();
        for (int read = 0; read < 5; ++read)
            EXPECT_EQ(preferences.synchronizedValueForKey("key"), Value("other domain"));
        EXPECT_EQ(errorsLogged(capture), 1u);

        std::filesystem::remove_all(path(), ignored);
        replace(one("key", "mended"));
        EXPECT_EQ(preferences.synchronizedValueForKey("key"), Value("mended"));
        replaceText("damaged again");
        for (int read = 0; read < 5; ++read)
            EXPECT_EQ(preferences.synchronizedValueForKey("key"), Value("other domain"));
        EXPECT_EQ(errorsLogged(capture), 2u);
    }
}

TEST_F(PreferencesTest, OneMebibyteIsTheLargestFileRead)
{
    Preferences preferences(directory());
    ASSERT_TRUE(preferences.addSuiteNamed(kDomain).ok());
    const std::string document = om::Vlist::writeXml(one("key", "big"));
    for (const size_t size : { Preferences::kMaxFileSize, Preferences::kMaxFileSize + 1 }) {
        replaceText(document + std::string(size - document.size(), '\n'));
        EXPECT_EQ(preferences.synchronizedValueForKey("key").isNone(), size > Preferences::kMaxFileSize) << size;
    }
}

TEST_F(PreferencesTest, DomainsAnswerInSearchListOrder)
{
    replace(Value::dictionary({ { "shared", "first" }, { "onlyFirst", 1 } }), "first");
    replace(Value::dictionary({ { "shared", "second" }, { "onlySecond", 2 } }), "second");

    Preferences preferences(directory());
    for (const char* domain : { "first", "second", "first" })
        ASSERT_TRUE(preferences.addSuiteNamed(domain).ok());
    preferences.synchronize();
    EXPECT_EQ(preferences.valueForKey("shared"), Value("first"));
    EXPECT_EQ(preferences.valueForKey("onlyFirst"), Value(1));
    EXPECT_EQ(preferences.valueForKey("onlySecond"), Value(2));
    EXPECT_TRUE(preferences.valueForKey("nowhere").isNone());

    Preferences reversed(directory());
    ASSERT_TRUE(reversed.addSuiteNamed("second").ok());
    ASSERT_TRUE(reversed.addSuiteNamed("first").ok());
    EXPECT_EQ(reversed.synchronizedValueForKey("shared"), Value("second"));
}

TEST_F(PreferencesTest, DomainNamesMustNameOneFile)
{
    const std::string longest(255 - 6, 'd'); // with ".vlist", 255 bytes
    Preferences preferences(directory());
    for (const std::string& valid : { longest, std::string("com.orvex.ombrel.userprefs") }) {
        EXPECT_TRUE(preferences.addSuiteNamed(valid).ok()) << valid;
        EXPECT_TRUE(preferences.setValue(valid, "key", 1).ok()) << valid;
    }
    for (const std::string& invalid : { longest + "d", std::string(), std::string(".."), std::string("a/b") }) {
        EXPECT_FALSE(preferences.addSuiteNamed(invalid).ok()) << invalid;
        EXPECT_FALSE(preferences.setValue(invalid, "key", 1).ok()) << invalid;
    }
}

TEST_F(PreferencesTest, SetValueRewritesTheWholeFileButNeverADamagedOne)
{
    Preferences preferences(directory());
    ASSERT_TRUE(preferences.setValue(kDomain, "kept", "yes").ok()); // makes the directory too
    ASSERT_TRUE(preferences.setValue(kDomain, "changed", 1).ok());
    ASSERT_TRUE(preferences.setValue(kDomain, "changed", 2).ok());
    ASSERT_TRUE(preferences.setValue(kDomain, "removed", true).ok());
    ASSERT_TRUE(preferences.setValue(kDomain, "removed", Value()).ok());
    const Value expected = Value::dictionary({ { "kept", "yes" }, { "changed", 2 } });
    EXPECT_EQ(contents(), om::Vlist::writeXml(expected));

    replaceText("not a vlist");
    EXPECT_FALSE(preferences.setValue(kDomain, "key", 1).ok());
    EXPECT_EQ(contents(), "not a vlist");
}

TEST(PreferencesLocation, PrefsDirDecidesElseTheUsersConfigurationOrEtc)
{
    ::setenv("PREFS_DIR", "/somewhere/prefs", 1);
    EXPECT_EQ(Preferences::defaultDirectory(), "/somewhere/prefs");
    EXPECT_EQ(Preferences().directory(), "/somewhere/prefs");
    ::unsetenv("PREFS_DIR");
    const std::string expected = ::geteuid() == 0 ? "/etc/omd/prefs" : om::Storage::configHome() + "/omd/prefs";
    EXPECT_EQ(Preferences::defaultDirectory(), expected);
}

// Readers on several threads while a writer replaces the file: every answer is one of the values
// written, never a torn or missing one.
TEST_F(PreferencesTest, ReadersAndAWriterShareOneObject)
{
    Preferences preferences(directory());
    ASSERT_TRUE(preferences.setValue(kDomain, "counter", 0).ok());
    ASSERT_TRUE(preferences.addSuiteNamed(kDomain).ok());
    constexpr int kWrites = 50;
    std::atomic<bool> done { false };
    std::atomic<int> wrongAnswers { 0 };
    std::vector<std::thread> readers;
    for (int i = 0; i < 3; ++i) {
        readers.emplace_back([&] {
            while (!done) {
                auto value = preferences.synchronizedValueForKey("counter").asInt64();
                if (!value || *value < 0 || *value > kWrites)
                    ++wrongAnswers;
            }
        });
    }
    for (int i = 1; i <= kWrites; ++i)
        ASSERT_TRUE(preferences.setValue(kDomain, "counter", i).ok());
    done = true;
    for (auto& reader : readers)
        reader.join();
    EXPECT_EQ(wrongAnswers, 0);
    EXPECT_EQ(preferences.synchronizedValueForKey("counter"), Value(kWrites));
}

// The consent store: grants and revocations per application, what survives reopening, and files
// that are not an intact consent database.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "platform/Consent.h"
#include "tests/support/BundleFixture.h"

namespace om {
namespace {

using Entries = std::vector<std::pair<std::string, bool>>;

Entries flatten(const std::vector<Consent::Entry>& entries)
{
    Entries flat;
    for (const auto& entry : entries)
        flat.emplace_back(entry.service, entry.granted);
    return flat;
}

class ConsentStore : public ::testing::Test {
protected:
    std::string path() const { return m_files.root() + "/state/consent.db"; }
    std::unique_ptr<Consent> open(Consent::Access access = Consent::Access::ReadWrite)
    {
        auto consent = Consent::open(path(), access);
        EXPECT_TRUE(consent.ok()) << consent.error().localizedDescription();
        return consent.ok() ? std::move(consent).releaseValue() : nullptr;
    }
    Entries entries(const std::string& bundle)
    {
        auto found = Consent::informationForBundle(path(), bundle);
        EXPECT_TRUE(found.ok()) << found.error().localizedDescription();
        return found.ok() ? flatten(*found) : Entries {};
    }

    test::BundleFixture m_files;
};

TEST_F(ConsentStore, GrantsAndRevocationsAreKeptPerBundleInFirstRecordedOrderAcrossReopening)
{
    struct Step {
        const char* bundle;
        const char* service;
        bool granted;
    };
    const Step steps[] = {
        { "com.example.a", "net", true },
        { "com.example.a", "camera", true },
        { "com.example.b", "net", false },
        { "com.example.a", "net", false }, // revoking keeps the entry where it was
        { "com.example.a", "net", true },
        { "com.example.a", "camera", false },
    };
    {
        auto consent = open();
        ASSERT_TRUE(consent);
        for (const auto& step : steps)
            ASSERT_TRUE(consent->set(step.bundle, step.service, step.granted).ok());
        EXPECT_EQ(flatten(*consent->entries("com.example.a")), (Entries { { "net", true }, { "camera", false } }));
    }
    EXPECT_EQ(entries("com.example.a"), (Entries { { "net", true }, { "camera", false } }));
    EXPECT_EQ(entries("com.example.b"), (Entries { { "net", false } }));
    EXPECT_EQ(entries("com.example.unknown"), Entries {});
}

TEST_F(ConsentStore, AMissingFileHoldsNothingAndIsMadeOnlyByAWriter)
{
    EXPECT_EQ(entries("com.example.a"), Entries {});
    EXPECT_FALSE(Consent::open(path(), Consent::Access::ReadOnly).ok());
    EXPECT_FALSE(std::filesystem::exists(path()));
    ASSERT_TRUE(open());
    EXPECT_TRUE(std::filesystem::exists(path()));
    EXPECT_EQ(entries("com.example.a"), Entries {});
}

TEST_F(ConsentStore, AReaderCannotWrite)
{
    ASSERT_TRUE(open());
    auto reader = open(Consent::Access::ReadOnly);
    ASSERT_TRUE(reader);
    EXPECT_FALSE(reader->set("com.example.a", "net", true).ok());
    EXPECT_EQ(entries("com.example.a"), Entries {});
}

TEST_F(ConsentStore, ADamagedOrForeignFileIsRefusedWithItsPathAndUntouched)
{
    struct Case {
        const char* name;
        std::string contents;
        const char* reason;
    };
    // A database file of some other program: one table and no schema version.
    const std::string foreign = [&] {
        const std::string other = m_files.root() + "/other.db";
        {
            auto consent = Consent::open(other, Consent::Access::ReadWrite);
            EXPECT_TRUE(consent.ok());
        }
        std::ifstream in(other, std::ios::binary);
        std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
        // user_version lives at offset 60 of the header; zero it to make the file anonymous.
        bytes.replace(60, 4, std::string(4, '\0'));
        return bytes;
    }();
    const Case cases[] = {
        { "text", std::string("this is not a database, only some text that is long enough to matter\n"),
            "not a database" },
        { "truncated header", std::string("SQLite format 3\0", 16) + std::string(84, '\x01'), "" },
        { "foreign", foreign, "not a consent database" },
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        test::BundleFixture::writeFileAt(path(), c.contents);
        for (auto access : { Consent::Access::ReadOnly, Consent::Access::ReadWrite }) {
            auto consent = Consent::open(path(), access);
            ASSERT_FALSE(consent.ok());
            const std::string message = consent.error().localizedDescription();
            EXPECT_NE(message.find("consent database " + path()), std::string::npos) << message;
            EXPECT_NE(message.find(c.reason), std::string::npos) << message;
        }
        EXPECT_FALSE(Consent::informationForBundle(path(), "com.example.a").ok());
        std::ifstream in(path(), std::ios::binary);
        EXPECT_EQ(std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>()), c.contents);
    }
}

} // namespace
} // namespace om

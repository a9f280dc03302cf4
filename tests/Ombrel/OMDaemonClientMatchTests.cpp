// Reading "match" replies into plug-in records, from replies made by hand: what each form carries
// beyond the record, elections as discovery judges them, and malformed forms and replies.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMDaemonClient.h"
#include "platform/Cbor.h"

using namespace om;

namespace {

const Uuid kFirst = *Uuid::parse("6BA7B810-9DAD-11D1-80B4-00C04FD430C8");
const Uuid kSecond = *Uuid::parse("00000000-0000-0000-0000-000000000001");

// A form as omd exports it, before what discovery adds.
Value form(const std::string& identifier, const Uuid& uuid, const std::string& path)
{
    const Value plugIn = Value::dictionary({ { "QSExtensionPointIdentifier", "com.orvex.share" },
        { "QSExtensionAttributes", Value::dictionary({ { "QSExtensionVersion", "2.0" } }) } });
    return Value::dictionary({
        { "hubProtocolVersion", 2u },
        { "path", path },
        { "systemResident", false },
        { "identifier", identifier },
        { "original-identifier", identifier },
        { "version", "2.0" },
        { "bundleInfo", Value::dictionary({ { "VBBundleIdentifier", identifier }, { "QSExtension", plugIn } }) },
        { "info", plugIn },
        { "uuid", uuid.string() },
        { "lastmodified", 1700000000 },
        { "annotations", Value::dictionary({}) },
        { "containingPath", "/Applications/A.app" },
    });
}

Value with(const Value& dictionary, std::vector<Value::Entry> changes)
{
    DictionaryBuilder builder(dictionary);
    for (auto& [key, value] : changes)
        builder.set(key, value);
    return builder.build();
}

Value replyWith(const Value& forms)
{
    return Value::dictionary({ { "matches", *OMDaemonClient::convertToConduit(forms, 3) } });
}

class OMDaemonClientMatch : public ::testing::Test {
protected:
    void SetUp() override
    {
        std::string pattern = (std::filesystem::temp_directory_path() / "ommatch-XXXXXX").string();
        ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
        m_directory = pattern;
        ::setenv("CONDUIT_DIR", m_directory.c_str(), 1);
        // Nothing listens: reading replies needs no daemon.
        m_client = OMDaemonClient::initWithServiceName("com.orvex.test.nobody");
    }
    void TearDown() override
    {
        m_client.reset();
        std::error_code ignored;
        std::filesystem::remove_all(m_directory, ignored);
    }

    Result<OMDaemonClient::MatchReply> read(const Result<Value>& reply) const
    {
        return m_client->matchesInReply(reply);
    }

    std::string m_directory;
    std::shared_ptr<OMDaemonClient> m_client;
};

} // namespace

TEST_F(OMDaemonClientMatch, EachFormBecomesARecordWithWhatDiscoveryAdded)
{
    const Value first = with(form("com.example.share", kFirst, "/Applications/A.app/PlugIns/Share.appex"),
        {
            { "uuid", "6ba7b810-9dad-11d1-80b4-00c04fd430c8" }, // lower-case text still names the plug-in
            { "annotations",
                Value::dictionary({ { "election", 1 }, { "extension", Value::dictionary({ { "pinned", true } }) } }) },
            { "extensions",
                Value::dictionary({ { ".", "token-whole" }, { "Presets", "token-presets" }, { "Bad", 7 } }) },
            { "overrider", kSecond.string() },
        });
    const Value second = with(form("com.example.share.v2", kSecond, "/Applications/B.app/PlugIns/Share.appex"),
        { { "overriding", "com.example.share" }, { "systemResident", true } });
    const Value reply = replyWith(Value::array({ first, second }));

    auto read = this->read(reply);
    ASSERT_TRUE(read.ok()) << read.error().localizedDescription();
    EXPECT_EQ(read->reply, reply);
    EXPECT_TRUE(read->skipped.empty());
    ASSERT_EQ(read->matches.size(), 2u);

    const auto& share = read->matches[0];
    EXPECT_EQ(share.plugIn->uuid(), kFirst);
    EXPECT_EQ(share.plugIn->identifier(), "com.example.share");
    EXPECT_EQ(share.plugIn->path(), "/Applications/A.app/PlugIns/Share.appex");
    EXPECT_EQ(share.plugIn->containingPath(), "/Applications/A.app");
    EXPECT_EQ(share.plugIn->lastModified(), 1700000000);
    EXPECT_EQ(share.plugIn->hubProtocolVersion(), 2u);
    EXPECT_EQ(share.form, first);
    EXPECT_EQ(share.election(), Value(1));
    EXPECT_TRUE(share.elected());
    EXPECT_EQ(share.extension(), Value::dictionary({ { "pinned", true } }));
    EXPECT_EQ(share.resourceToken("."), "token-whole");
    EXPECT_EQ(share.resourceToken("Presets"), "token-presets");
    EXPECT_EQ(share.resourceToken("Bad"), std::nullopt); // a token that is no text grants nothing
    EXPECT_EQ(share.resourceTokens.size(), 2u);
    EXPECT_EQ(share.overrider, kSecond.string());
    EXPECT_EQ(share.overriding, std::nullopt);

    const auto& replacement = read->matches[1];
    EXPECT_EQ(replacement.plugIn->uuid(), kSecond);
    EXPECT_TRUE(replacement.plugIn->onSystemVolume());
    EXPECT_EQ(replacement.overriding, "com.example.share");
    EXPECT_EQ(replacement.overrider, std::nullopt);
    EXPECT_TRUE(replacement.election().isNone());
    EXPECT_FALSE(replacement.elected());
    EXPECT_TRUE(replacement.resourceTokens.empty());
}

// Discovery reads the low 8 bits of the election's integer value; so does elected().
TEST_F(OMDaemonClientMatch, ElectedFollowsTheLowEightBitsOfTheElection)
{
    struct Case {
        Value annotations;
        bool elected;
    };
    const Case cases[] = {
        { Value::dictionary({}), false },
        { Value::dictionary({ { "election", 0 } }), false },
        { Value::dictionary({ { "election", 1 } }), true },
        { Value::dictionary({ { "election", 2u } }), true },
        { Value::dictionary({ { "election", 256 } }), false },
        { Value::dictionary({ { "election", 257 } }), true },
        { Value::dictionary({ { "election", 1.0 } }), true },
        { Value::dictionary({ { "election", true } }), true },
        { Value::dictionary({ { "election", "1" } }), false }, // not a number: no election
        { Value::dictionary({ { "extension", Value::dictionary({}) } }), false },
    };
    for (const auto& test : cases) {
        auto read = this->read(replyWith(
            Value::array({ with(form("com.x", kFirst, "/x.appex"), { { "annotations", test.annotations } }) })));
        ASSERT_TRUE(read.ok() && read->matches.size() == 1) << test.annotations.description();
        EXPECT_EQ(read->matches[0].elected(), test.elected) << test.annotations.description();
        EXPECT_EQ(read->matches[0].election(), test.annotations["election"]) << test.annotations.description();
    }
}

TEST_F(OMDaemonClientMatch, FormsThatMakeNoRecordAreSkippedAndListed)
{
    const Value good = form("com.good", kFirst, "/good.appex");
    const Value forms = Value::array({
        "not a form",
        with(good, { { "path", Value() } }),
        with(good, { { "path", 5 } }),
        good,
        with(good, { { "identifier", Value() } }),
        with(good, { { "bundleInfo", Value::dictionary({ { "VBBundleIdentifier", "com.good" } }) } }),
        with(good, { { "bundleInfo", "text" } }),
        // Without "bundleInfo" the record has no dictionaries, but it is a record.
        with(good, { { "bundleInfo", Value() }, { "uuid", kSecond.string() } }),
    });
    auto read = this->read(replyWith(forms));
    ASSERT_TRUE(read.ok());

    ASSERT_EQ(read->matches.size(), 2u);
    EXPECT_EQ(read->matches[0].plugIn->uuid(), kFirst);
    EXPECT_EQ(read->matches[1].plugIn->uuid(), kSecond);
    EXPECT_TRUE(read->matches[1].plugIn->plugInDictionary().isNone());
    std::vector<std::pair<size_t, std::string>> skipped;
    for (const auto& entry : read->skipped)
        skipped.emplace_back(entry.index, entry.reason);
    const std::string noPlugIn = "\"bundleInfo\" is not a dictionary with a \"QSExtension\" dictionary";
    EXPECT_EQ(skipped,
        (std::vector<std::pair<size_t, std::string>> { { 0, "not a dictionary" }, { 1, "no \"path\" text" },
            { 2, "no \"path\" text" }, { 4, "no \"identifier\" text" }, { 5, noPlugIn }, { 6, noPlugIn } }));
}

TEST_F(OMDaemonClientMatch, RepliesThatCarryNoArrayOfFormsAreErrors)
{
    struct Case {
        const char* name;
        Result<Value> reply;
        std::optional<int64_t> code; // none: read, with no plug-in
        std::string message;
    };
    std::vector<uint8_t> notCbor = { 0xFF, 0x00 };
    const Case cases[] = {
        { "success without matches", Value::dictionary({}), std::nullopt, "" },
        { "empty array", replyWith(Value::array({})), std::nullopt, "" },
        { "transport error", OMError("Conduit", 3, "Connection invalid"), 4, "Connection invalid" },
        { "daemon error", Value::dictionary({ { "errorcode", 11u }, { "error", "unauthorized discovery flag" } }), 11,
            "unauthorized discovery flag" },
        { "matches not encoded", Value::dictionary({ { "matches", Value::array({}) } }), 4,
            "invalid reply format (matches)" },
        { "matches not CBOR", Value::dictionary({ { "matches", Value::data(notCbor) } }), 4,
            "invalid reply format (matches)" },
        { "matches a dictionary", replyWith(Value::dictionary({ { "a", 1 } })), 4, "invalid reply format (matches)" },
    };
    for (const auto& test : cases) {
        auto read = this->read(test.reply);
        if (!test.code) {
            ASSERT_TRUE(read.ok()) << test.name;
            EXPECT_TRUE(read->matches.empty() && read->skipped.empty()) << test.name;
            continue;
        }
        ASSERT_FALSE(read.ok()) << test.name;
        EXPECT_EQ(read.error().code(), *test.code) << test.name;
        EXPECT_EQ(read.error().localizedDescription(), test.message) << test.name;
    }
}

// Only protocol version 3 has an encoding of the array; a client speaking another cannot read it.
TEST_F(OMDaemonClientMatch, AnotherProtocolVersionCannotDecodeTheForms)
{
    m_client->setProtocolVersion(2);
    auto read = this->read(replyWith(Value::array({ form("com.x", kFirst, "/x.appex") })));
    ASSERT_FALSE(read.ok());
    EXPECT_EQ(read.error().code(), 4);
}

TEST_F(OMDaemonClientMatch, AnExportedRecordReadsBackEqual)
{
    const Value plugIn = Value::dictionary({ { "QSExtensionPointIdentifier", "com.orvex.share" } });
    const Value info = Value::dictionary({ { "VBBundleIdentifier", "com.example.share" },
        { "VBBundleShortVersionString", "3.1" }, { "QSExtension", plugIn } });
    auto record = OMPlugInCore::initWithName(
        "com.example.share", OMBundle::fileURL("/Applications/A.app/PlugIns/Share.appex"), info, Value(), kFirst);
    ASSERT_TRUE(record);
    record->setOriginalIdentifier("com.example.share");
    record->canonicalize();
    record->setAnnotations(Value::dictionary({ { "election", 1 } }));
    record->setLocalizedName("Share");
    const Value exported = record->exportForm();
    ASSERT_FALSE(exported.isNone());

    auto read = this->read(replyWith(Value::array({ exported })));
    ASSERT_TRUE(read.ok());
    ASSERT_EQ(read->matches.size(), 1u);
    const auto& rebuilt = *read->matches[0].plugIn;
    EXPECT_EQ(rebuilt, *record);
    EXPECT_EQ(rebuilt.identifier(), record->identifier());
    EXPECT_EQ(rebuilt.path(), record->path());
    // The reader does not canonicalize: the version omd computed travels in the form.
    EXPECT_EQ(read->matches[0].form["version"], Value("3.1"));
    EXPECT_EQ(rebuilt.localizedName(), "Share");
    EXPECT_TRUE(read->matches[0].elected());
}

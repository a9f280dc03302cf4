// "annotate" and "bulk-annotate" against the real daemon: every refusal with its code and text,
// what a refusal part-way leaves behind, what is kept across a restart and SIGKILL, and the
// change notification as a real listener on the bus receives it.
#include <gtest/gtest.h>
#include <signal.h>

#include <utility>

#include "platform/Format.h"
#include "tests/support/ChangeCounter.h"
#include "tests/support/RegistrarDaemon.h"

namespace om::test {
namespace {

const std::string kShare = RegistrarDaemon::samplesPath() + "/Notes.app/PlugIns/Share.appex";
const std::string kKeyboard = RegistrarDaemon::samplesPath() + "/Keys.app/PlugIns/Keyboard.appex";

// The daemon and a listener meet on a private message bus, so that no other test's notifications
// are counted.
class AnnotationRequests : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_changes = std::make_unique<ChangeCounter>(m_omd.state().root());
        ASSERT_EQ(m_changes->failure(), "");
        ASSERT_TRUE(m_omd.start({ m_changes->busSetting() }));
        ASSERT_EQ(codeOf(m_omd.add({ kShare, kKeyboard })), 0u);
        m_share = *m_omd.uuidAt(kShare);
        m_keyboard = *m_omd.uuidAt(kKeyboard);
    }

    Value annotate(const std::vector<Value>& uuids, const Value& annotations)
    {
        DictionaryBuilder request(daemonRequest("annotate"));
        request.set("uuids", Value::array(uuids));
        if (!annotations.isNone())
            request.set("annotations", annotations);
        return m_omd.call(request.build());
    }

    Value bulk(const Value& annotations)
    {
        return m_omd.call(DictionaryBuilder(daemonRequest("bulk-annotate")).set("annotations", annotations).build());
    }

    // The annotations "match" shows for a plug-in.
    Value annotationsOf(const Uuid& uuid)
    {
        const Value reply = m_omd.match(Value::dictionary({ { "com.orvex.uuid", Value::string(uuid.string()) } }));
        const auto forms = reply["matches"].elements();
        return forms.empty() ? Value() : forms[0]["annotations"];
    }

    size_t announced() { return m_changes->announcedSince(m_omd); }

    std::unique_ptr<ChangeCounter> m_changes;
    RegistrarDaemon m_omd;
    Uuid m_share;
    Uuid m_keyboard;
};

TEST_F(AnnotationRequests, RefusalsCarryTheirCodeAndTextAndStoreNothing)
{
    const Value share = Value::uuid(m_share);
    const Value bogus = Value::uuid(Uuid::random());
    struct Row {
        const char* name;
        Value reply;
        uint64_t code;
        const char* error;
    };
    const std::vector<Row> rows {
        { "annotate without annotations", annotate({ share }, Value()), 4,
            "invalid request format (bad annotations dictionary)" },
        { "annotations not a dictionary", annotate({ share }, Value::array({})), 4,
            "invalid request format (bad annotations dictionary)" },
        { "election as text", annotate({ share }, Value::dictionary({ { "election", "1" } })), 4,
            "invalid request format (annotation election)" },
        { "extension not a dictionary", annotate({ share }, Value::dictionary({ { "extension", 1 } })), 4,
            "invalid request format (annotation extension)" },
        { "uuids holding text", annotate({ Value::string(m_share.string()) }, Value::dictionary({ { "election", 1 } })),
            4, "invalid request (bad uuid array)" },
        { "unknown uuid", annotate({ bogus }, Value::dictionary({ { "election", 1 } })), 4,
            "no such plugin (uuid not found)" },
        { "bulk without annotations", bulk(Value::string("x")), 4,
            "invalid request format (bad annotations dictionary)" },
        { "bulk value as text, key no uuid", bulk(Value::dictionary({ { "nonsense", "x" } })), 18,
            "annotations values must be dictionaries" },
        { "bulk key no uuid", bulk(Value::dictionary({ { "nonsense", Value::dictionary({}) } })), 18,
            "invalid plug-in UUID value" },
        { "bulk unknown uuid", bulk(Value::dictionary({ { Uuid::random().string(), Value::dictionary({}) } })), 2,
            "no plug-in with the requested uuid" },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(codeOf(row.reply), row.code);
        EXPECT_EQ(errorOf(row.reply), row.error);
    }
    const Value missingUuids = m_omd.call(DictionaryBuilder(daemonRequest("annotate"))
                                              .set("annotations", Value::dictionary({ { "election", 1 } }))
                                              .build());
    EXPECT_EQ(errorOf(missingUuids), "invalid request format (uuid)");
    EXPECT_EQ(annotationsOf(m_share), Value::dictionary({}));
    EXPECT_EQ(announced(), 0u);
}

TEST_F(AnnotationRequests, AnElectionForTwoPlugInsIsStoredForBothAndAnnouncedOnce)
{
    const Value reply
        = annotate({ Value::uuid(m_share), Value::uuid(m_keyboard) }, Value::dictionary({ { "election", 2 } }));
    ASSERT_EQ(codeOf(reply), 0u) << errorOf(reply);
    EXPECT_EQ(annotationsOf(m_share)["election"], Value::integer(2));
    EXPECT_EQ(annotationsOf(m_keyboard)["election"], Value::integer(2));
    const std::string line = format("plug-in %s(%s) election := 2", "com.example.notes.share", m_share.string());
    EXPECT_TRUE(m_omd.daemon().waitForLines([&](const auto& lines) {
        for (const auto& entry : lines) {
            if (entry.message.ends_with(line))
                return true;
        }
        return false;
    }));
    EXPECT_EQ(announced(), 1u);
}

TEST_F(AnnotationRequests, ChangesWithoutElectionOrExtensionAndEmptyListsDoNothingButAnswer)
{
    // No accepted key: nothing is looked at, not even the missing "uuids".
    EXPECT_EQ(codeOf(m_omd.call(DictionaryBuilder(daemonRequest("annotate"))
                                    .set("annotations", Value::dictionary({ { "other", 1 } }))
                                    .build())),
        0u);
    EXPECT_EQ(announced(), 0u);
    // An empty list stores nothing but is announced; so is an empty bulk change.
    EXPECT_EQ(codeOf(annotate({}, Value::dictionary({ { "election", 1 } }))), 0u);
    EXPECT_EQ(codeOf(bulk(Value::dictionary({}))), 0u);
    EXPECT_EQ(announced(), 2u);
    EXPECT_EQ(annotationsOf(m_share), Value::dictionary({}));
}

TEST_F(AnnotationRequests, ARefusalPartWayKeepsTheChangesBeforeItAndAnnouncesNothing)
{
    const Value reply = annotate({ Value::uuid(m_share), Value::uuid(Uuid::random()), Value::uuid(m_keyboard) },
        Value::dictionary({ { "election", 1 } }));
    EXPECT_EQ(errorOf(reply), "no such plugin (uuid not found)");
    EXPECT_EQ(annotationsOf(m_share)["election"], Value::integer(1));
    EXPECT_TRUE(annotationsOf(m_keyboard)["election"].isNone());
    EXPECT_EQ(announced(), 0u);
}

TEST_F(AnnotationRequests, BulkReplacesTheExtensionAndKeepsTheElection)
{
    const Value first = Value::dictionary({ { "colour", "red" }, { "size", 3 } });
    ASSERT_EQ(codeOf(annotate({ Value::uuid(m_share) },
                  Value::dictionary({ { "election", 1 }, { "extension", first }, { "ignored", true } }))),
        0u);
    const Value second = Value::dictionary({ { "colour", "blue" } });
    ASSERT_EQ(codeOf(bulk(Value::dictionary({ { m_share.string(), second } }))), 0u);
    EXPECT_EQ(annotationsOf(m_share), Value::dictionary({ { "election", 1 }, { "extension", second } }));
}

TEST_F(AnnotationRequests, AcknowledgedChoicesSurviveARestartAndSigkill)
{
    ASSERT_EQ(codeOf(annotate({ Value::uuid(m_share) }, Value::dictionary({ { "election", 1 } }))), 0u);
    ASSERT_TRUE(m_omd.daemon().stop());
    ASSERT_TRUE(m_omd.start());
    EXPECT_EQ(annotationsOf(m_share)["election"], Value::integer(1));

    // Killed the moment the reply is in: the reply is only sent once the file is on disk.
    ASSERT_EQ(codeOf(annotate({ Value::uuid(m_keyboard) }, Value::dictionary({ { "election", 3 } }))), 0u);
    m_omd.daemon().sendSignal(SIGKILL);
    ASSERT_TRUE(m_omd.daemon().waitForExit());
    ASSERT_TRUE(m_omd.start());
    EXPECT_EQ(annotationsOf(m_keyboard)["election"], Value::integer(3));
    EXPECT_EQ(annotationsOf(m_share)["election"], Value::integer(1));
}

} // namespace
} // namespace om::test

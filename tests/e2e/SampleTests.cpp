// The sample installation end to end: real omd (entitled to manage jobd) and jobd on one Conduit
// directory, the sample plug-ins registered, the sample host finding, readying, launching and
// talking to them, and "omctl ps" following an instance through busy, idle and a terminating hold.
#include <gtest/gtest.h>
#include <unistd.h>

#include "tests/e2e/JobdTestSupport.h"
#include "tests/support/RegistrarDaemon.h"

#include <nlohmann/json.hpp>

namespace om::test {
namespace {

const std::string kPhotos = RegistrarDaemon::samplesPath() + "/Photos.app";
const std::string kShare = RegistrarDaemon::samplesPath() + "/Notes.app/PlugIns/Share.appex";
const std::string kFilters = kPhotos + "/PlugIns/Filters.appex";
constexpr const char* kFiltersIdentifier = "com.example.photos.filters";

std::string sampleHostPath()
{
    return std::string(OM_BINARY_DIR) + "/sample-host/sample_host";
}

class Samples : public JobdTest {
protected:
    void SetUp() override
    {
        JobdTest::SetUp();
        if (HasFatalFailure())
            return;
        m_omd.setExecutable(m_omd.copyProgram(
            builtDaemonPath(), m_dir + "/bin/omd", Value::dictionary({ { kJobManagerEntitlement, true } })));
        m_omd.setConduitDirectory(m_jobd->conduitDirectory());
        ASSERT_TRUE(m_omd.start({ { "JOBD_SERVICE_NAME", kJobdTestService } }));
        ASSERT_EQ(codeOf(m_omd.add({ kShare, kFilters })), 0u);
    }

    // omctl (or the sample host) against this omd and jobd, which the environment names.
    static ChildProcess::Outcome omctl(std::vector<std::string> arguments)
    {
        arguments.insert(arguments.begin(), RegistrarDaemon::omctlPath());
        return ChildProcess::capture(arguments);
    }

    // The instances "omctl --json ps" lists.
    static nlohmann::json instances()
    {
        const auto outcome = omctl({ "--json", "ps" });
        EXPECT_EQ(outcome.status, 0) << outcome.err;
        auto parsed = nlohmann::json::parse(outcome.out, nullptr, false);
        EXPECT_FALSE(parsed.is_discarded()) << outcome.out;
        return parsed.is_discarded() ? nlohmann::json::array() : parsed["instances"];
    }

    // This process readied for the Filters plug-in by omd, then its instance launched by jobd.
    std::unique_ptr<HostedInstance> launchFilters()
    {
        const Value reply = m_omd.call(DictionaryBuilder(daemonRequest("ready"))
                                           .set("uuids", Value::array({ Value::uuid(*m_omd.uuidAt(kFilters)) }))
                                           .set("flags", Value::unsignedInteger(uint64_t { 0 }))
                                           .build());
        EXPECT_EQ(codeOf(reply), 0u) << errorOf(reply);
        auto launched = JobManagerLaunch(kFilters + "/Filters");
        EXPECT_TRUE(launched.ok()) << (launched.ok() ? "" : launched.error().localizedDescription());
        if (!launched.ok())
            return nullptr;
        return std::make_unique<HostedInstance>(std::move(launched).releaseValue());
    }

    RegistrarDaemon m_omd;
};

TEST_F(Samples, TheSampleHostFindsReadiesLaunchesAndPrintsThePlugInsOwnReply)
{
    struct Row {
        const char* name;
        std::vector<std::string> arguments;
        int status;
        std::vector<std::string> out; // each appears in standard output, in this order
        std::string err;
    };
    const std::vector<Row> rows {
        { "share", { "com.orvex.share-services" }, 0,
            { "omd found 1 plug-in(s)", "com.example.notes.share", "omd readied it", "launching " + kShare + "/Share",
                "jobd launched instance pid", "reply:", "the text and links given" },
            "" },
        { "filters, read from the bundle's presets", { "com.orvex.photo-editing", "list" }, 0,
            { kFiltersIdentifier, "jobd launched instance pid", "\"list\"", "warm: temperature=+12", "mono:" }, "" },
        { "a busy declaration answered", { "--plugin", kFiltersIdentifier, "com.orvex.photo-editing", "begin" }, 0,
            { "reply:", "busy", "true" }, "" },
        { "the named plug-in is not there", { "--plugin", "com.example.other", "com.orvex.photo-editing" }, 1,
            { "omd found 1 plug-in(s)" }, "no plug-in to use for com.orvex.photo-editing named com.example.other" },
        { "an extension point with nothing registered", { "com.orvex.keyboard-service" }, 1, { "omd found 0" },
            "no plug-in to use" },
        { "no extension point", {}, 2, {}, "usage:" },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        std::vector<std::string> arguments = row.arguments;
        arguments.insert(arguments.begin(), sampleHostPath());
        const auto outcome = ChildProcess::capture(arguments);
        EXPECT_EQ(outcome.status, row.status) << outcome.out << outcome.err;
        size_t at = 0;
        for (const std::string& expected : row.out) {
            at = outcome.out.find(expected, at);
            ASSERT_NE(at, std::string::npos) << expected << " in\n" << outcome.out;
        }
        EXPECT_NE(outcome.err.find(row.err), std::string::npos) << outcome.err;
        if (row.status != 0) {
            EXPECT_EQ(outcome.out.find("launching"), std::string::npos) << outcome.out;
        }
    }
}

TEST_F(Samples, PsFollowsTheBusySampleAndListsNothingAfterATerminatingHoldOnItsApp)
{
    EXPECT_EQ(omctl({ "ps" }).out, "no plug-in instances running\n");
    auto filters = launchFilters();
    ASSERT_TRUE(filters);
    struct Step {
        const char* op;
        bool busy; // as ps shows it after the step
    };
    // A plain request leaves it idle: it is busy only while it works.
    const std::vector<Step> steps { { "list", false }, { "begin", true }, { "list", true }, { "end", false } };
    for (const Step& step : steps) {
        SCOPED_TRACE(step.op);
        const Value reply = filters->ask(Value::dictionary({ { "op", step.op } }));
        EXPECT_EQ(reply["plugin"], Value::string(kFiltersIdentifier)) << reply.description();
        const nlohmann::json listed = instances();
        ASSERT_EQ(listed.size(), 1u) << listed.dump();
        EXPECT_EQ(listed[0]["plugin"], kFiltersIdentifier);
        EXPECT_EQ(listed[0]["host"], ::getpid());
        EXPECT_EQ(listed[0]["pid"], filters->pid());
        EXPECT_EQ(listed[0]["profile"], "plugin");
        EXPECT_EQ(listed[0]["busy"], step.busy);
        const std::string table = omctl({ "ps" }).out;
        EXPECT_TRUE(table.starts_with("HOST")) << table;
        EXPECT_NE(table.find(std::string(kFiltersIdentifier) + " " + std::to_string(filters->pid())), std::string::npos)
            << table;
        EXPECT_TRUE(table.ends_with(step.busy ? "yes\n" : "no\n")) << table;
    }

    const auto held = omctl({ "hold", "--terminate", kPhotos });
    ASSERT_EQ(held.status, 0) << held.err;
    EXPECT_TRUE(instances().empty());
    EXPECT_EQ(omctl({ "ps" }).out, "no plug-in instances running\n");
}

TEST_F(Samples, PsSaysWhichJobdItCouldNotReach)
{
    const auto outcome = ChildProcess::capture(
        { RegistrarDaemon::omctlPath(), "ps" }, { { "JOBD_SERVICE_NAME", "com.orvex.jobd.absent" } });
    EXPECT_EQ(outcome.status, 1);
    EXPECT_NE(outcome.err.find("omctl: ps: jobd (com.orvex.jobd.absent) did not list"), std::string::npos)
        << outcome.err;
    EXPECT_EQ(omctl({ "ps", "extra" }).status, 2);
}

} // namespace
} // namespace om::test

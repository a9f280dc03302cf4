// omctl's plug-in commands against the real daemon with the sample installation registered:
// "match" as a table and as JSON, "elect" by identifier and its refusals, "annotate" printing the
// daemon's codes, "why" for hidden and visible plug-ins, and "watch" on a real message bus.
#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <filesystem>
#include <set>

#include "platform/Preferences.h"
#include "platform/Registrar.h"
#include "tests/support/BundleFixture.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/PrivateBus.h"
#include "tools/omctl/OmctlJson.h"

namespace om::test {
namespace {

using Outcome = ChildProcess::Outcome;

const std::string kSamples = std::string(OM_BINARY_DIR) + "/samples";
const std::string kOmctl = std::string(OM_BINARY_DIR) + "/tools/omctl/omctl";
const std::vector<std::string> kSamplePlugIns = {
    kSamples + "/Keys.app/PlugIns/Keyboard.appex",
    kSamples + "/Notes.app/PlugIns/Share.appex",
    kSamples + "/Notes.app/PlugIns/Templates.bundle",
    kSamples + "/Photos.app/PlugIns/Filters.appex",
    kSamples + "/Photos.app/PlugIns/Importer.plugin",
    kSamples + "/Photos.app/PlugIns/Preview.appex",
};
constexpr const char* kUserPrefs = "com.orvex.ombrel.userprefs";

std::string json(const Value& value)
{
    return OmctlJson::write(value);
}

bool contains(const std::string& text, const std::string& part)
{
    return text.find(part) != std::string::npos;
}

// The lines of text, split at newlines.
std::vector<std::string> lines(const std::string& text)
{
    std::vector<std::string> result;
    size_t start = 0;
    for (size_t end; (end = text.find('\n', start)) != std::string::npos; start = end + 1)
        result.push_back(text.substr(start, end - start));
    return result;
}

// The words of a table row.
std::vector<std::string> columns(const std::string& line)
{
    std::vector<std::string> words;
    size_t start = line.find_first_not_of(' ');
    while (start != std::string::npos) {
        size_t end = line.find(' ', start);
        words.push_back(line.substr(start, end - start));
        start = end == std::string::npos ? end : line.find_first_not_of(' ', end);
    }
    return words;
}

class OmctlPlugIns : public ::testing::Test {
protected:
    void SetUp() override { start(); }

    void start(std::vector<std::pair<std::string, std::string>> extra = {})
    {
        m_environment = {
            { "REGISTRAR_DB", m_state.root() + "/registrar.db" },
            { "REGISTRAR_CONTAINERS", m_state.root() + "/containers" },
            { "REGISTRAR_SDK_DIR", kSamples + "/SDKs" },
            { "PREFS_DIR", m_state.root() + "/prefs" },
        };
        m_environment.insert(m_environment.end(), extra.begin(), extra.end());
        DaemonProcess::Options options;
        options.executable = builtDaemonPath();
        options.environment = m_environment;
        m_daemon = std::make_unique<DaemonProcess>(options);
        ASSERT_TRUE(m_daemon->waitForSocket()) << m_daemon->stderrText();
        m_environment.emplace_back("CONDUIT_DIR", m_daemon->conduitDirectory());
    }

    void registerSamples(std::vector<std::string> extra = {})
    {
        std::vector<std::string> arguments = { "add" };
        arguments.insert(arguments.end(), kSamplePlugIns.begin(), kSamplePlugIns.end());
        arguments.insert(arguments.end(), extra.begin(), extra.end());
        Outcome added = omctl(arguments);
        ASSERT_EQ(added.status, 0) << added.err;
    }

    Outcome omctl(std::vector<std::string> arguments, const std::string& program = kOmctl)
    {
        arguments.insert(arguments.begin(), program);
        return ChildProcess::capture(arguments, m_environment);
    }

    std::string uuidOf(const std::string& path)
    {
        RegistrarWorkspace::Configuration configuration { m_state.root() + "/registrar.db", kSamples + "/SDKs",
            m_state.root() + "/containers" };
        auto workspace = RegistrarWorkspace::open(configuration, RegistrarWorkspace::Access::ReadOnly);
        auto record = workspace.ok() ? workspace.value()->plugInAtPath(path) : nullptr;
        EXPECT_TRUE(record) << path;
        return record ? record->uuid().string() : std::string();
    }

    // The table row of an identifier: UUID, identifier, version, election, path.
    std::vector<std::string> rowOf(const std::string& table, const std::string& identifier)
    {
        for (const auto& line : lines(table)) {
            auto words = columns(line);
            if (words.size() == 5 && words[1] == identifier)
                return words;
        }
        return {};
    }

    BundleFixture m_state;
    BundleFixture m_bundles;
    std::unique_ptr<DaemonProcess> m_daemon;
    std::vector<std::pair<std::string, std::string>> m_environment;
};

TEST_F(OmctlPlugIns, MatchPrintsOneRowPerVisiblePlugInAndTheSameAsJson)
{
    registerSamples();
    Outcome table = omctl({ "match" });
    Outcome json = omctl({ "--json", "match" });

    ASSERT_EQ(table.status, 0) << table.err;
    auto rows = lines(table.out);
    ASSERT_FALSE(rows.empty());
    EXPECT_EQ(
        columns(rows.front()), (std::vector<std::string> { "UUID", "IDENTIFIER", "VERSION", "ELECTION", "PATH" }));
    // Sorted by identifier; the importer is dedicated to its application, which omctl is not.
    std::vector<std::string> identifiers;
    for (size_t i = 1; i < rows.size(); ++i)
        identifiers.push_back(columns(rows[i]).at(1));
    EXPECT_EQ(identifiers,
        (std::vector<std::string> { "com.example.keys.keyboard", "com.example.notes.share",
            "com.example.notes.templates", "com.example.photos.filters", "com.example.photos.preview" }));
    const auto filters = rowOf(table.out, "com.example.photos.filters");
    ASSERT_EQ(filters.size(), 5u);
    EXPECT_EQ(filters[0], uuidOf(kSamplePlugIns[3]));
    EXPECT_EQ(filters[2], "4.0");
    EXPECT_EQ(filters[3], "on"); // elected automatically: its executable carries the entitlement
    EXPECT_EQ(filters[4], kSamplePlugIns[3]);
    EXPECT_EQ(rowOf(table.out, "com.example.notes.share").at(3), "-");

    ASSERT_EQ(json.status, 0) << json.err;
    Result<Value> forms = OmctlJson::parse(json.out);
    ASSERT_TRUE(forms.ok()) << forms.error().localizedDescription() << json.out;
    ASSERT_EQ(forms->count(), identifiers.size());
    for (size_t i = 0; i < identifiers.size(); ++i) {
        const Value& form = forms->at(i);
        EXPECT_EQ(*form.stringFor("identifier"), identifiers[i]);
        EXPECT_EQ(*form.stringFor("uuid"), columns(rows[i + 1]).at(0));
        EXPECT_TRUE(form["annotations"].isDictionary());
        EXPECT_TRUE(form["bundleInfo"]["QSExtension"].isDictionary());
    }
}

TEST_F(OmctlPlugIns, MatchRulesSelectAndRefuseAsTheDaemonDoes)
{
    registerSamples();
    struct Case {
        std::vector<std::string> arguments;
        int status;
        std::vector<std::string> identifiers; // in table order
        std::string error;
    };
    const Case cases[] = {
        { { "match", "QSExtensionIdentifier=com.example.notes.share" }, 0, { "com.example.notes.share" }, "" },
        { { "match", "QSExtensionVersion=>=4" }, 0, { "com.example.photos.filters", "com.example.photos.preview" },
            "" },
        { { "match", "--json-rules", R"({"QSUserElection": "1"})" }, 0, { "com.example.photos.filters" }, "" },
        { { "match", "--json-rules", R"({"QSExtensionIdentifier": ["com.example.keys.keyboard"]})",
              "QSExtensionVersion=2.1" },
            0, { "com.example.keys.keyboard" }, "" },
        { { "match", "QSExtensionIdentifier=com.nothing" }, 0, {}, "" },
        { { "match", "--flags", "0x200" }, 1, {}, "omctl: unauthorized discovery flag (OMDiscoverAll) (code 11)\n" },
        { { "match", "--flags", "12x" }, 2, {}, "omctl: match: --flags needs a number" },
        { { "match", "--json-rules", "[1]" }, 2, {}, "omctl: match: --json-rules needs a JSON object" },
        { { "match", "--json-rules", "{" }, 2, {}, "omctl: match: --json-rules: " },
        { { "match", "=x" }, 2, {}, "omctl: match: a rule is KEY=PATTERN, not =x" },
        { { "match", "--frobnicate" }, 2, {}, "omctl: match: unknown option --frobnicate" },
    };
    for (const auto& test : cases) {
        Outcome result = omctl(test.arguments);
        const std::string shown = test.arguments.back();
        EXPECT_EQ(result.status, test.status) << shown << "\n" << result.err;
        EXPECT_TRUE(result.err.starts_with(test.error)) << shown << "\n" << result.err;
        if (test.status != 0)
            continue;
        if (test.identifiers.empty()) {
            EXPECT_EQ(result.out, "no plug-in matches\n") << shown;
            continue;
        }
        auto rows = lines(result.out);
        std::vector<std::string> identifiers;
        for (size_t i = 1; i < rows.size(); ++i)
            identifiers.push_back(columns(rows[i]).at(1));
        EXPECT_EQ(identifiers, test.identifiers) << shown << "\n" << result.out;
    }
}

TEST_F(OmctlPlugIns, ElectByIdentifierShowsInMatchAndSurvivesARestart)
{
    registerSamples();
    const std::string share = uuidOf(kSamplePlugIns[1]);

    Outcome on = omctl({ "elect", "com.example.notes.share", "on" });
    ASSERT_EQ(on.status, 0) << on.err;
    EXPECT_EQ(on.out, "elected " + share + "\n");
    EXPECT_EQ(rowOf(omctl({ "match" }).out, "com.example.notes.share").at(3), "on");

    Outcome off = omctl({ "--json", "elect", share, "off" });
    ASSERT_EQ(off.status, 0) << off.err;
    EXPECT_TRUE(contains(off.out, "\"election\": 0")) << off.out;
    EXPECT_EQ(rowOf(omctl({ "match" }).out, "com.example.notes.share").at(3), "off");
    // Off is an election of 0, which discovery treats as none made.
    auto unelected = OmctlJson::parse(omctl({ "--json", "match", "QSUserElection=0" }).out);
    ASSERT_TRUE(unelected.ok());
    std::set<std::string> uuids;
    for (const Value& form : unelected->elements())
        uuids.insert(*form.stringFor("uuid"));
    EXPECT_TRUE(uuids.count(share)) << json(unelected.value());

    // The election is the daemon's to keep: a new daemon on the same state reads it back.
    ASSERT_TRUE(omctl({ "elect", share, "on" }).status == 0);
    const std::string annotations = m_daemon->root() + "/annotations.vlist";
    const std::string kept = m_state.root() + "/annotations.vlist";
    std::filesystem::copy_file(annotations, kept);
    ASSERT_TRUE(m_daemon->stop().has_value());
    m_daemon.reset();
    m_environment.pop_back(); // the old CONDUIT_DIR
    DaemonProcess::Options options;
    options.executable = builtDaemonPath();
    options.environment = m_environment;
    options.arguments = { "-d", kept };
    m_daemon = std::make_unique<DaemonProcess>(options);
    ASSERT_TRUE(m_daemon->waitForSocket()) << m_daemon->stderrText();
    m_environment.emplace_back("CONDUIT_DIR", m_daemon->conduitDirectory());
    EXPECT_EQ(rowOf(omctl({ "match" }).out, "com.example.notes.share").at(3), "on");
}

TEST_F(OmctlPlugIns, ElectRefusesWhatItCannotNameExactly)
{
    // A second registration of the share plug-in's identifier, in another application.
    const std::string app = m_bundles.makeApp("Other", "com.example.other");
    const std::string twin = m_bundles.makePlugIn(app, "Share", "com.example.notes.share", "com.orvex.share-services");
    registerSamples({ twin });
    const std::string share = uuidOf(kSamplePlugIns[1]);
    const std::string other = uuidOf(twin);

    Outcome ambiguous = omctl({ "elect", "com.example.notes.share", "on" });
    EXPECT_EQ(ambiguous.status, 1);
    EXPECT_TRUE(ambiguous.err.starts_with(
        "omctl: elect: identifier com.example.notes.share is ambiguous: 2 plug-ins have it; give one of their UUIDs:"))
        << ambiguous.err;
    EXPECT_TRUE(contains(ambiguous.err, share) && contains(ambiguous.err, other)) << ambiguous.err;
    // Nothing was elected.
    auto both = OmctlJson::parse(
        omctl({ "--json", "match", "--flags", "5", "QSExtensionIdentifier=com.example.notes.share" }).out);
    ASSERT_TRUE(both.ok());
    ASSERT_EQ(both->count(), 2u);
    for (const Value& form : both->elements())
        EXPECT_EQ(form["annotations"], Value::dictionary({})) << form["uuid"].description();

    struct Case {
        std::vector<std::string> arguments;
        int status;
        std::string error;
    };
    const Case cases[] = {
        { { "elect", "com.example.nothing", "on" }, 1,
            "omctl: elect: no plug-in with identifier com.example.nothing is visible to omctl\n" },
        { { "elect", "00000000-0000-0000-0000-000000000001", "on" }, 1,
            "omctl: no such plugin (uuid not found) (code 4)\n" },
        { { "elect", share, "yes" }, 2, "omctl: elect: give a UUID or an identifier, then on or off\n" },
        { { "elect", share }, 2, "omctl: elect: give a UUID or an identifier, then on or off\n" },
    };
    for (const auto& test : cases) {
        Outcome result = omctl(test.arguments);
        EXPECT_EQ(result.status, test.status) << result.err;
        EXPECT_TRUE(result.err.starts_with(test.error)) << result.err;
    }
    Outcome byUuid = omctl({ "elect", other, "on" });
    EXPECT_EQ(byUuid.status, 0) << byUuid.err;
}

TEST_F(OmctlPlugIns, AnnotateSendsTheChangeAndPrintsTheDaemonsRefusals)
{
    registerSamples();
    const std::string share = uuidOf(kSamplePlugIns[1]);
    const std::string keys = uuidOf(kSamplePlugIns[0]);
    struct Case {
        std::vector<std::string> arguments;
        int status;
        std::string error;
    };
    const Case cases[] = {
        { { "annotate", share, R"(election="yes")" }, 1,
            "omctl: invalid request format (annotation election) (code 4)\n" },
        { { "annotate", share, "extension=[1]" }, 1,
            "omctl: invalid request format (annotation extension) (code 4)\n" },
        { { "annotate", share, "00000000-0000-0000-0000-000000000001", "election=2" }, 1,
            "omctl: no such plugin (uuid not found) (code 4)\n" },
        { { "annotate", "--bulk", "not-a-uuid={}" }, 1, "omctl: invalid plug-in UUID value (code 18)\n" },
        { { "annotate", "--bulk", share + "=1" }, 1, "omctl: annotations values must be dictionaries (code 18)\n" },
        { { "annotate", "--bulk", "00000000-0000-0000-0000-000000000001={}" }, 1,
            "omctl: no plug-in with the requested uuid (code 2)\n" },
        { { "annotate", share, "election=yes" }, 2, "omctl: annotate: election: " },
        { { "annotate", "not-a-uuid", "election=1" }, 2, "omctl: annotate: not a UUID: not-a-uuid\n" },
        { { "annotate", share }, 2, "omctl: annotate: give at least one UUID and one KEY=JSONVALUE\n" },
        { { "annotate", "--bulk" }, 2, "omctl: annotate: --bulk needs at least one UUID=JSONOBJECT\n" },
    };
    for (const auto& test : cases) {
        Outcome result = omctl(test.arguments);
        EXPECT_EQ(result.status, test.status) << test.arguments.back() << "\n" << result.err;
        EXPECT_TRUE(result.err.starts_with(test.error)) << test.arguments.back() << "\n" << result.err;
    }
    // The first UUID before the unknown one kept its change; the daemon does not undo it.
    auto matched = OmctlJson::parse(omctl({ "--json", "match", "QSExtensionIdentifier=com.example.notes.share" }).out);
    ASSERT_TRUE(matched.ok());
    EXPECT_EQ(matched->at(0)["annotations"]["election"], Value(2));

    Outcome both = omctl({ "annotate", share, keys, R"(extension={"pinned": true, "when": {"$date": 0}})" });
    ASSERT_EQ(both.status, 0) << both.err;
    EXPECT_EQ(both.out, "annotated " + share + "\nannotated " + keys + "\n");
    Outcome bulk = omctl({ "annotate", "--bulk", keys + R"(={"order": 3})" });
    ASSERT_EQ(bulk.status, 0) << bulk.err;
    matched = OmctlJson::parse(omctl({ "--json", "match" }).out);
    ASSERT_TRUE(matched.ok());
    for (const Value& form : matched->elements()) {
        if (*form.stringFor("uuid") == share) {
            EXPECT_EQ(form["annotations"]["extension"],
                Value::dictionary({ { "pinned", true }, { "when", Value::date(0) } }));
        } else if (*form.stringFor("uuid") == keys) {
            EXPECT_EQ(form["annotations"]["extension"], Value::dictionary({ { "order", 3 } }));
        }
    }
}

TEST_F(OmctlPlugIns, WhyNamesTheUsersExclusionThatHidesAPlugIn)
{
    registerSamples();
    const std::string share = uuidOf(kSamplePlugIns[1]);
    Preferences preferences(m_state.root() + "/prefs");
    const Value exclusions = Value::array({
        Value::dictionary({ { "QSExtensionIdentifier", "com.example.keys.keyboard" } }),
        Value::dictionary({ { "QSExtensionIdentifier", "com.example.notes.share" } }),
    });
    ASSERT_TRUE(preferences.setValue(kUserPrefs, "exclusions", exclusions).ok());

    EXPECT_TRUE(rowOf(omctl({ "match" }).out, "com.example.notes.share").empty());
    Outcome why = omctl({ "why", share });
    ASSERT_EQ(why.status, 0) << why.err;
    const std::string file = m_state.root() + "/prefs/" + kUserPrefs + ".vlist";
    EXPECT_TRUE(contains(why.out, "plug-in " + share + " com.example.notes.share 1.2\n")) << why.out;
    EXPECT_TRUE(contains(why.out, "  HIDES user exclusions: the user's exclusion 2 {")) << why.out;
    EXPECT_TRUE(contains(why.out, "com.example.notes.share")) << why.out;
    EXPECT_TRUE(contains(why.out, "} in " + file + " matches it\n")) << why.out;
    EXPECT_TRUE(contains(why.out, "  note  election: unknown: omd does not show the plug-in to omctl\n")) << why.out;
    EXPECT_TRUE(contains(why.out, "  note  hold: unknown: omd keeps the plug-in from omctl for the reasons above\n"))
        << why.out;
    EXPECT_TRUE(contains(why.out, "verdict: hidden from this host by the user exclusions rule: ")) << why.out;

    Outcome json = omctl({ "--json", "why", share });
    auto explained = OmctlJson::parse(json.out);
    ASSERT_TRUE(explained.ok()) << json.out;
    EXPECT_EQ((*explained)["visible"], Value(false));
    size_t hides = 0;
    for (const Value& check : (*explained)["checks"].elements())
        hides += check["outcome"] == Value("hides");
    EXPECT_EQ(hides, 1u) << json.out;
}

TEST_F(OmctlPlugIns, WhyShowsAVisiblePlugInAndADedicatedOneToItsOwnApplication)
{
    registerSamples();
    const std::string filters = uuidOf(kSamplePlugIns[3]);
    Outcome visible = omctl({ "why", filters });
    ASSERT_EQ(visible.status, 0) << visible.err;
    for (const std::string& line :
        std::vector<std::string> { "host: a host without entitlements or application bundle (omctl itself)\n",
            "  shows location: inside the application " + kSamples + "/Photos.app\n",
            "  shows dedicated: no: any host may see it\n", "  shows host entitlement: the plug-in requires none\n",
            "  note  election: on (1); ", "  shows hold: none: omd shows the plug-in to omctl\n",
            "verdict: omd shows it to this host when the host's own rules select it\n" })
        EXPECT_TRUE(contains(visible.out, line)) << line << "\n" << visible.out;
    EXPECT_FALSE(contains(visible.out, "HIDES")) << visible.out;

    // The importer is dedicated: hidden from omctl, shown to the application that contains it.
    const std::string importer = uuidOf(kSamplePlugIns[4]);
    Outcome asOmctl = omctl({ "why", importer });
    EXPECT_TRUE(contains(asOmctl.out,
        "  HIDES dedicated: yes, to its own application; the host has no application "
        "bundle\n"))
        << asOmctl.out;
    Outcome asPhotos = omctl({ "why", importer, "--host", kSamples + "/Photos.app/Photos" });
    ASSERT_EQ(asPhotos.status, 0) << asPhotos.err;
    EXPECT_TRUE(contains(asPhotos.out, "host: " + kSamples + "/Photos.app/Photos\n")) << asPhotos.out;
    EXPECT_TRUE(contains(
        asPhotos.out, "  shows dedicated: yes, and it lives in the host's own " + kSamples + "/Photos.app/PlugIns\n"))
        << asPhotos.out;

    struct Case {
        std::vector<std::string> arguments;
        int status;
        std::string error;
    };
    const Case cases[] = {
        { { "why" }, 2, "omctl: why: give one plug-in UUID\n" },
        { { "why", "com.example.photos.filters" }, 2, "omctl: why: give one plug-in UUID\n" },
        { { "why", filters, "--host", "/bin/true", "--pid", "1" }, 2, "omctl: why: give --host or --pid, not both\n" },
        { { "why", filters, "--pid", "0" }, 2, "omctl: why: --pid needs a process id\n" },
        { { "why", "00000000-0000-0000-0000-000000000001" }, 1,
            "omctl: why: no plug-in 00000000-0000-0000-0000-000000000001 in the Registrar database " },
        { { "why", filters, "--host", m_bundles.root() + "/missing" }, 1, "omctl: why: realpath " },
    };
    for (const auto& test : cases) {
        Outcome result = omctl(test.arguments);
        EXPECT_EQ(result.status, test.status) << result.err;
        EXPECT_TRUE(result.err.starts_with(test.error)) << result.err;
    }
}

// "watch" on a bus of the test's own, which omd posts on too.
class OmctlWatch : public OmctlPlugIns {
protected:
    void SetUp() override
    {
        m_bus = std::make_unique<PrivateBus>(m_state.root());
        ASSERT_FALSE(m_bus->address().empty()) << "dbus-daemon did not start: " << m_bus->log();
        start({ { "DBUS_SESSION_BUS_ADDRESS", m_bus->address() } });
    }

    std::unique_ptr<PrivateBus> m_bus;
};

TEST_F(OmctlWatch, PrintsALinePerNotificationUntilASignalThenExitsZero)
{
    registerSamples();
    for (int signal : { SIGTERM, SIGINT }) {
        ChildProcess::Running watch({ kOmctl, "watch" }, m_environment);
        auto ready = watch.readLine(ChildProcess::Running::Stream::Err);
        ASSERT_EQ(ready, "omctl: watching com.orvex.ombrel.annotation-change (Ctrl-C stops)");

        ASSERT_EQ(omctl({ "elect", "com.example.notes.share", "on" }).status, 0);
        auto first = watch.readLine(ChildProcess::Running::Stream::Out);
        ASSERT_TRUE(first);
        EXPECT_TRUE(first->ends_with("Z com.orvex.ombrel.annotation-change")) << *first;
        ASSERT_EQ(omctl({ "annotate", "--bulk", uuidOf(kSamplePlugIns[0]) + "={}" }).status, 0);
        auto second = watch.readLine(ChildProcess::Running::Stream::Out);
        ASSERT_TRUE(second);
        EXPECT_TRUE(second->ends_with(" com.orvex.ombrel.annotation-change")) << *second;

        watch.signal(signal);
        EXPECT_EQ(watch.wait(), 0) << signal;
    }
}

TEST_F(OmctlWatch, JsonLinesCarryTheNameAndTheTime)
{
    registerSamples();
    ChildProcess::Running watch({ kOmctl, "--json", "watch" }, m_environment);
    ASSERT_TRUE(watch.readLine(ChildProcess::Running::Stream::Err));
    // A refused change posts nothing; the next line is the accepted one's.
    ASSERT_EQ(omctl({ "annotate", "--bulk", "nope={}" }).status, 1);
    ASSERT_EQ(omctl({ "elect", "com.example.notes.share", "off" }).status, 0);

    auto line = watch.readLine(ChildProcess::Running::Stream::Out);
    ASSERT_TRUE(line);
    auto notification = OmctlJson::parse(*line);
    ASSERT_TRUE(notification.ok()) << *line;
    EXPECT_EQ((*notification)["name"], Value("com.orvex.ombrel.annotation-change"));
    EXPECT_TRUE((*notification)["time"].isDate()) << *line;
    watch.signal(SIGTERM);
    EXPECT_EQ(watch.wait(), 0);
}

} // namespace
} // namespace om::test

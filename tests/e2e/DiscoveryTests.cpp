// "match" against the real daemon over bundles of its real Registrar, asked by real client
// processes: which plug-ins each kind of host sees (bundle, entitlements, sandbox, flags), the
// user's exclusions, duplicate versions, replacements, the election prefilter, and hostile rules.
#include <gtest/gtest.h>

#include <filesystem>
#include <map>

#include "platform/Format.h"
#include "platform/Vlist.h"
#include "tests/support/RegistrarDaemon.h"

namespace om::test {
namespace {

constexpr const char* kPoint = "com.example.point";
constexpr uint64_t kDiscoverAllVersions = 0x1;
constexpr uint64_t kDiscoverSystemOnly = 0x8;
constexpr uint64_t kDiscoverAll = 0x200;

Value manager()
{
    return Value::dictionary({ { "com.orvex.private.ombrel.manager", Value::boolean(true) } });
}

class Discovery : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(m_omd.start());
        m_host = makeApp("Host", "com.example.host");
        m_other = makeApp("Other", "com.example.other");
        plugIn("open", m_other + "/PlugIns/Open.appex");
        plugIn("private", m_other + "/PlugIns/Private.appex", { { "Dedicated", Value::boolean(true) } });
        plugIn("own", m_host + "/PlugIns/Own.appex", { { "Dedicated", Value::boolean(true) } });
        plugIn("guarded", m_other + "/PlugIns/Guarded.appex",
            { { "QSExtensionHostEntitlement", Value::string("com.example.guard") } });
        // Outside the system and outside any application: registered, but never a plug-in anyone
        // sees, not even a manager asking for everything.
        plugIn("stray", m_bundles.root() + "/Loose/Stray.appex");
        const auto uuids = m_omd.addNamed(m_paths);
        ASSERT_EQ(uuids.size(), m_paths.size());
        for (const auto& [name, uuid] : uuids)
            m_names[uuid.string()] = name;
    }

    // An application whose executable is a real client program, so that it can ask as itself.
    std::string makeApp(const std::string& name, const std::string& identifier)
    {
        const std::string app = m_bundles.makeBundle(name + ".app", BundleFixture::appInfo(identifier, name));
        m_omd.copyProgram(RegistrarDaemon::testClientPath(), app + "/" + name);
        return app;
    }

    // A plug-in com.example.<name> of kPoint, with extra plug-in keys and a version, and an ELF
    // executable carrying entitlements when there are any.
    void plugIn(const std::string& name, const std::string& path, const std::map<std::string, Value>& keys = {},
        const std::string& version = "1", const Value& entitlements = Value(),
        const std::string& identifier = std::string())
    {
        DictionaryBuilder extension;
        extension.set("QSExtensionPointIdentifier", Value(kPoint));
        for (const auto& [key, value] : keys)
            extension.set(key, value);
        const std::string id = identifier.empty() ? "com.example." + name : identifier;
        const Value info = DictionaryBuilder(BundleFixture::appInfo(id, "Run"))
                               .set("VBBundleShortVersionString", Value::string(version))
                               .set("QSExtension", extension.build())
                               .build();
        const std::string relative = std::filesystem::relative(path, m_bundles.root()).string();
        m_bundles.makeBundle(relative, info);
        if (!entitlements.isNone())
            m_omd.copyProgram(std::string(OM_BINARY_DIR) + "/tests/om_test_peer", path + "/Run", entitlements);
        m_paths[name] = path;
    }

    std::set<std::string> names(const Value& reply)
    {
        std::set<std::string> found;
        for (const std::string& uuid : uuidsIn(reply))
            found.insert(m_names.count(uuid) ? m_names[uuid] : uuid);
        return found;
    }

    Value matchRequest(
        uint64_t flags, const Value& rules = Value::dictionary({ { "QSExtensionPointIdentifier", kPoint } }))
    {
        return DictionaryBuilder(daemonRequest("match"))
            .set("rules", rules)
            .set("flags", Value::unsignedInteger(flags))
            .build();
    }

    // A client program with these entitlements, standing alone or as the host application.
    std::string client(const Value& entitlements, bool asHost = false)
    {
        const std::string path = asHost ? m_host + "/Host" : m_omd.state().root() + format("/client-%u", ++m_clients);
        return m_omd.copyProgram(RegistrarDaemon::testClientPath(), path, entitlements);
    }

    RegistrarDaemon m_omd;
    BundleFixture m_bundles;
    std::string m_host;
    std::string m_other;
    std::map<std::string, std::string> m_paths; // name -> bundle path
    std::map<std::string, std::string> m_names; // UUID text -> name
    unsigned m_clients = 0;
};

struct Host {
    const char* name;
    Value entitlements;
    bool asHost;
    uint64_t flags;
    std::set<std::string> sees;
};

TEST_F(Discovery, EachHostSeesWhatItsBundleEntitlementsAndFlagsAllow)
{
    const Value guardTrue = Value::dictionary({ { "com.example.guard", Value::boolean(true) } });
    const std::vector<Host> hosts {
        { "no bundle, no entitlements", Value(), false, 0, { "open" } },
        { "the host application sees its own dedicated plug-in", Value(), true, 0, { "open", "own" } },
        { "system only hides everything outside the system", Value(), true, kDiscoverSystemOnly, {} },
        { "host entitlement true", guardTrue, false, 0, { "open", "guarded" } },
        { "host entitlement false", Value::dictionary({ { "com.example.guard", Value::boolean(false) } }), false, 0,
            { "open" } },
        { "host entitlement 0", Value::dictionary({ { "com.example.guard", Value::integer(0) } }), false, 0,
            { "open" } },
        { "host entitlement as text", Value::dictionary({ { "com.example.guard", Value::string("no") } }), false, 0,
            { "open", "guarded" } },
        { "allowed plug-ins narrow the host entitlement",
            DictionaryBuilder(guardTrue)
                .set("com.orvex.developer.ombrel.allowedplugins",
                    Value::dictionary({ { "QSExtensionIdentifier", Value::string("com.example.guarded") } }))
                .build(),
            false, 0, { "guarded" } },
        { "malformed allowed plug-ins refuse everything",
            Value::dictionary({ { "com.orvex.developer.ombrel.allowedplugins", Value::string("all") } }), false, 0,
            {} },
        { "a manager with every flag sees everything", manager(), false, kDiscoverAll | kDiscoverSystemOnly,
            { "open", "own", "private", "guarded" } },
        { "a manager without the flag is an ordinary host", manager(), false, 0, { "open" } },
    };
    for (const Host& host : hosts) {
        SCOPED_TRACE(host.name);
        const Value reply = m_omd.callFrom(client(host.entitlements, host.asHost), matchRequest(host.flags));
        EXPECT_EQ(codeOf(reply), 0u) << errorOf(reply);
        EXPECT_EQ(names(reply), host.sees);
    }
    EXPECT_TRUE(m_omd.daemon().waitForLines([](const auto& lines) {
        for (const auto& line : lines) {
            if (line.message.find("cannot use plugin") != std::string::npos
                && line.message.ends_with(": invalid host restriction entitlement"))
                return true;
        }
        return false;
    }));
}

TEST_F(Discovery, EveryPlugInFlagIsRefusedToAnyoneButAnUnsandboxedManager)
{
    const Value denied = m_omd.callFrom(client(Value()), matchRequest(kDiscoverAll));
    EXPECT_EQ(codeOf(denied), 11u);
    EXPECT_EQ(errorOf(denied), "unauthorized discovery flag (OMDiscoverAll)");

    // The manager's own program, run in a user namespace of its own, counts as sandboxed.
    const std::string program = client(manager());
    const std::string request = m_omd.state().writeFile("all.vlist", Vlist::writeXml(matchRequest(kDiscoverAll)));
    const auto sandboxed = m_omd.run({ "/usr/bin/bwrap", "--unshare-user", "--dev-bind", "/", "/", program, request });
    ASSERT_EQ(sandboxed.status, 0) << "bubblewrap could not run a client in a user namespace: " << sandboxed.err;
    auto reply = Vlist::parse(sandboxed.out);
    ASSERT_TRUE(reply.ok());
    EXPECT_EQ(codeOf(reply.value()), 11u);
    EXPECT_EQ(errorOf(reply.value()), "unauthorized discovery flag (OMDiscoverAll)");
}

TEST_F(Discovery, MalformedRulesAreRefusedAndAbsentRulesMeanEveryPlugIn)
{
    for (const Value& rules : { Value::string("x"), Value::array({}), Value::integer(1) }) {
        const Value reply = m_omd.call(matchRequest(0, rules));
        EXPECT_EQ(codeOf(reply), 4u);
        EXPECT_EQ(errorOf(reply), "invalid request format (bad rules dictionary)");
    }
    EXPECT_EQ(names(m_omd.match(Value())), (std::set<std::string> { "open" }));
    // Only protocol version 3 can carry the plug-ins; an older client gets a bare success.
    const Value old = m_omd.call(DictionaryBuilder(daemonRequest("match", 2)).build());
    EXPECT_EQ(codeOf(old), 0u);
    EXPECT_TRUE(old["matches"].isNone());
}

TEST_F(Discovery, UserExclusionsHideEvenFromAManagerAndTakeEffectAtTheNextRequest)
{
    const std::string prefs = m_omd.prefsDirectory() + "/com.orvex.ombrel.userprefs.vlist";
    const Value exclusions = Value::dictionary({ { "exclusions",
        Value::array({ Value::string("not a pattern"),
            Value::dictionary({ { "QSExtensionIdentifier", Value::string("com.example.open") } }) }) } });
    BundleFixture::writeFileAt(prefs, Vlist::writeXml(exclusions));
    const std::string managerClient = client(manager());

    EXPECT_EQ(names(m_omd.match(Value())), std::set<std::string> {});
    EXPECT_EQ(names(m_omd.callFrom(managerClient, matchRequest(kDiscoverAll))),
        (std::set<std::string> { "own", "private", "guarded" }));
    EXPECT_TRUE(m_omd.daemon().waitForLines([](const auto& lines) {
        for (const auto& line : lines) {
            if (line.message.ends_with("globally excluded"))
                return true;
        }
        return false;
    }));

    // A damaged file counts as no exclusions at all; a changed one is read again.
    BundleFixture::writeFileAt(prefs, "<vlist");
    EXPECT_EQ(names(m_omd.match(Value())), (std::set<std::string> { "open" }));
    BundleFixture::writeFileAt(prefs, Vlist::writeXml(exclusions));
    EXPECT_EQ(names(m_omd.match(Value())), std::set<std::string> {});
}

TEST_F(Discovery, OneVersionPerIdentifierUnlessEveryVersionIsAskedFor)
{
    plugIn("old", m_other + "/PlugIns/Old.appex", {}, "1.9", Value(), "com.example.twice");
    plugIn("new", m_host + "/PlugIns/New.appex", {}, "1.10", Value(), "com.example.twice");
    ASSERT_EQ(codeOf(m_omd.add({ m_paths["old"], m_paths["new"] })), 0u);
    for (const char* name : { "old", "new" })
        m_names[m_omd.uuidAt(m_paths[name])->string()] = name;

    const Value rules = Value::dictionary({ { "QSExtensionIdentifier", Value::string("com.example.twice") } });
    EXPECT_EQ(names(m_omd.match(rules)), (std::set<std::string> { "new" }));
    EXPECT_EQ(names(m_omd.match(rules, kDiscoverAllVersions)), (std::set<std::string> { "old", "new" }));
}

TEST_F(Discovery, AReplacementAndWhatItReplacesNameEachOther)
{
    plugIn("replacer", m_host + "/PlugIns/Replacer.appex", {}, "1",
        Value::dictionary({ { "com.orvex.developer.replace-plugin", Value::string("com.example.open") } }));
    ASSERT_EQ(codeOf(m_omd.add({ m_paths["replacer"] })), 0u);
    const std::string replacer = m_omd.uuidAt(m_paths["replacer"])->string();

    const Value reply = m_omd.match(Value::dictionary({ { "QSExtensionPointIdentifier", kPoint } }));
    std::map<std::string, Value> forms;
    for (const Value& form : reply["matches"].elements())
        forms[*form.stringFor("identifier")] = form;
    ASSERT_EQ(forms.size(), 2u) << reply.description();
    EXPECT_EQ(*forms["com.example.open"].stringFor("overrider"), replacer);
    EXPECT_EQ(*forms["com.example.replacer"].stringFor("overriding"), "com.example.open");
}

TEST_F(Discovery, ElectionPatternsArePushedIntoTheRegistrarOnlyWhenPlainOrExact)
{
    const std::string open = m_omd.uuidAt(m_paths["open"])->string();
    Value annotate = DictionaryBuilder(daemonRequest("annotate"))
                         .set("uuids", Value::array({ Value::uuid(*Uuid::parse(open)) }))
                         .set("annotations", Value::dictionary({ { "election", Value::integer(257) } }))
                         .build();
    ASSERT_EQ(codeOf(m_omd.call(annotate)), 0u);

    struct Row {
        Value pattern;
        std::set<std::string> found;
        bool filtered; // whether the Registrar's filter ran ("rg filter" lines)
    };
    const std::vector<Row> rows {
        { Value::string("1"), { "open" }, true },
        { Value::string("=1"), { "open" }, true },
        { Value::string("01"), {}, true }, // election texts carry no leading zeros
        { Value::array({ Value::string("0"), Value::string("1") }), { "open" }, true },
        { Value::string(">0"), { "open" }, false },
        { Value::array({ Value::string("1"), Value::string("!0") }), { "open" }, false },
        { Value::integer(1), { "open" }, false },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.pattern.description());
        m_omd.readLogSoFar();
        const size_t before = m_omd.daemon().countMessages("rg filter com.example.open -> 1")
            + m_omd.daemon().countMessages("rg filter com.example.open -> 0");
        const Value rules
            = Value::dictionary({ { "QSExtensionPointIdentifier", kPoint }, { "QSUserElection", row.pattern } });
        EXPECT_EQ(names(m_omd.match(rules)), row.found);
        m_omd.readLogSoFar();
        const size_t after = m_omd.daemon().countMessages("rg filter com.example.open -> 1")
            + m_omd.daemon().countMessages("rg filter com.example.open -> 0");
        EXPECT_EQ(after > before, row.filtered);
    }
}

TEST_F(Discovery, HostileRulesAreAnsweredAndTheDaemonCarriesOn)
{
    // Describing 100,000 rules in debug lines is the log's cost, not discovery's.
    ASSERT_TRUE(m_omd.daemon().stop());
    ASSERT_TRUE(m_omd.start({ { "EVLOG_LEVEL", "default" } }));
    std::vector<Value::Entry> manyKeys;
    for (int i = 0; i < 100000; ++i)
        manyKeys.emplace_back(format("key-%d", i), Value::string("x"));
    ArrayBuilder manyPatterns;
    for (int i = 0; i < 100000; ++i)
        manyPatterns.append(Value::string(format("com.example.%d", i)));
    Value deep = Value::string("leaf");
    for (int i = 0; i < 100; ++i)
        deep = Value::dictionary({ { "QSExtensionPointIdentifier", deep } });

    std::vector<Value> rules { Value::dictionary(std::move(manyKeys)),
        Value::dictionary({ { "QSExtensionIdentifier", manyPatterns.build() } }), deep };
    const std::vector<Value> oddValues { Value::integer(-1), Value::real(0.5), Value::boolean(true),
        Value::data(std::vector<uint8_t> { 1, 2, 3 }), Value::array({ Value::dictionary({}) }),
        Value::dictionary({ { "", Value::integer(1) } }), Value::uuid(Uuid::random()), Value::string("") };
    for (const char* key :
        { "QSExtensionPointIdentifier", "QSExtensionIdentifier", "QSUserElection", "QSExtensionContainingApp",
            "QSExtensionActivationRule", "ENTITLEMENT:x", "com.orvex.uuid", "Dedicated" }) {
        for (const Value& value : oddValues)
            rules.push_back(Value::dictionary({ { key, value } }));
    }
    for (const Value& rule : rules) {
        const Value reply = m_omd.match(rule);
        EXPECT_EQ(codeOf(reply), 0u) << errorOf(reply);
    }
    EXPECT_EQ(names(m_omd.match(Value())), (std::set<std::string> { "open" }));
    EXPECT_TRUE(m_omd.daemon().running());
}

} // namespace
} // namespace om::test

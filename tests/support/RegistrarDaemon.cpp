#include "tests/support/RegistrarDaemon.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "platform/ConduitMessageEncoding.h"
#include "platform/Format.h"
#include "platform/Vlist.h"

namespace om::test {

namespace fs = std::filesystem;

std::string RegistrarDaemon::omctlPath()
{
    return std::string(OM_BINARY_DIR) + "/tools/omctl/omctl";
}

std::string RegistrarDaemon::testClientPath()
{
    return std::string(OM_BINARY_DIR) + "/tests/om_test_client";
}

std::string RegistrarDaemon::samplesPath()
{
    return std::string(OM_BINARY_DIR) + "/samples";
}

bool RegistrarDaemon::start(std::vector<std::pair<std::string, std::string>> extra)
{
    m_peer.reset();
    m_daemon.reset();
    DaemonProcess::Options options;
    options.executable = m_executable.value_or(builtDaemonPath());
    options.conduitDirectory = m_conduitDirectory;
    options.arguments = { "-d", annotationsPath() };
    options.privateDatabase = false;
    options.environment = {
        { "REGISTRAR_DB", m_state.root() + "/registrar.db" },
        { "REGISTRAR_CONTAINERS", m_state.root() + "/containers" },
        { "REGISTRAR_SDK_DIR", samplesPath() + "/SDKs" },
        { "PREFS_DIR", prefsDirectory() },
    };
    options.environment.insert(options.environment.end(), extra.begin(), extra.end());
    m_daemon = std::make_unique<DaemonProcess>(options);
    if (!m_daemon->waitForSocket()) {
        ADD_FAILURE() << m_daemon->stderrText();
        return false;
    }
    auto peer = DaemonPeer::connect(*m_daemon);
    if (!peer)
        return false;
    m_peer.emplace(std::move(*peer));
    return true;
}

Value RegistrarDaemon::call(const Value& request)
{
    auto reply = m_peer->call(request);
    EXPECT_TRUE(reply) << "no reply to " << request.description() << "\n" << m_daemon->stderrText();
    return reply.value_or(Value());
}

Value RegistrarDaemon::add(const std::vector<std::string>& paths)
{
    return call(pathsRequest("add", paths));
}

std::map<std::string, Uuid> RegistrarDaemon::addNamed(const std::map<std::string, std::string>& paths)
{
    std::vector<std::string> list;
    for (const auto& [name, path] : paths)
        list.push_back(path);
    const Value reply = add(list);
    EXPECT_EQ(codeOf(reply), 0u) << errorOf(reply);
    std::map<std::string, Uuid> uuids;
    for (const auto& [name, path] : paths) {
        auto uuid = uuidAt(path);
        if (!uuid) {
            ADD_FAILURE() << "not registered: " << path;
            return {};
        }
        uuids.emplace(name, *uuid);
    }
    return uuids;
}

Value RegistrarDaemon::match(const Value& rules, uint64_t flags)
{
    DictionaryBuilder request(daemonRequest("match"));
    if (!rules.isNone())
        request.set("rules", rules);
    request.set("flags", Value::unsignedInteger(flags));
    Value reply = call(request.build());
    if (auto matches = ConduitMessageEncoding::decode(reply["matches"]))
        reply = DictionaryBuilder(reply).set("matches", *matches).build();
    return reply;
}

void RegistrarDaemon::readLogSoFar()
{
    const uint64_t flags = 0x10000 + ++m_barriers;
    call(DictionaryBuilder(daemonRequest("bulk")).set("flags", Value::unsignedInteger(flags)).build());
    EXPECT_TRUE(m_daemon->waitForMessage(format("bulk options 0x%lx not supported", flags)));
}

std::shared_ptr<RegistrarWorkspace> RegistrarDaemon::registrar()
{
    RegistrarWorkspace::Configuration configuration { m_state.root() + "/registrar.db", samplesPath() + "/SDKs",
        m_state.root() + "/containers" };
    auto workspace = RegistrarWorkspace::open(configuration, RegistrarWorkspace::Access::ReadOnly);
    EXPECT_TRUE(workspace.ok()) << workspace.error().localizedDescription();
    return workspace.ok() ? workspace.value() : nullptr;
}

std::optional<Uuid> RegistrarDaemon::uuidAt(const std::string& path)
{
    auto workspace = registrar();
    auto record = workspace ? workspace->plugInAtPath(path) : nullptr;
    return record ? std::optional<Uuid>(record->uuid()) : std::nullopt;
}

std::string RegistrarDaemon::copyProgram(const std::string& program, const std::string& path, const Value& entitlements)
{
    fs::create_directories(fs::path(path).parent_path());
    fs::copy_file(program, path, fs::copy_options::overwrite_existing);
    if (!entitlements.isNone()) {
        const std::string file
            = m_state.writeFile(format("entitlements-%u.vlist", ++m_requestFiles), Vlist::writeXml(entitlements));
        EXPECT_EQ(ChildProcess::capture({ std::string(OM_SOURCE_DIR) + "/scripts/entitle", path, file }).status, 0);
    }
    return path;
}

ChildProcess::Outcome RegistrarDaemon::run(const std::vector<std::string>& arguments)
{
    return ChildProcess::capture(arguments, { { "CONDUIT_DIR", m_daemon->conduitDirectory() } });
}

Value RegistrarDaemon::callFrom(const std::string& client, const Value& request)
{
    const std::string file = m_state.writeFile(format("request-%u.vlist", ++m_requestFiles), Vlist::writeXml(request));
    const auto outcome = run({ client, file });
    EXPECT_EQ(outcome.status, 0) << outcome.err;
    auto reply = Vlist::parse(outcome.out);
    return reply.ok() ? reply.value() : Value();
}

uint64_t codeOf(const Value& reply)
{
    return reply["errorcode"].asUInt64().value_or(0);
}

std::string errorOf(const Value& reply)
{
    const std::string* text = reply.stringFor("error");
    return text ? *text : std::string();
}

std::set<std::string> uuidsIn(const Value& reply)
{
    std::set<std::string> uuids;
    for (const Value& form : reply["matches"].elements()) {
        if (const std::string* uuid = form.stringFor("uuid"))
            uuids.insert(*uuid);
    }
    return uuids;
}

Value pathsRequest(std::string_view name, const std::vector<std::string>& paths)
{
    ArrayBuilder list;
    for (const auto& path : paths)
        list.append(Value::string(path));
    return DictionaryBuilder(daemonRequest(name)).set("paths", list.build()).build();
}

} // namespace om::test

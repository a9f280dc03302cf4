// RegistrarDaemon: the real omd over a Registrar, preferences and annotation database that live in
// the fixture rather than in the daemon's own temporary directory, so that a restarted daemon finds
// them again; with a raw peer connected, and helpers for entitled client programs.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/Registrar.h"
#include "platform/Uuid.h"
#include "platform/Value.h"
#include "tests/support/BundleFixture.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/DaemonProcess.h"

namespace om::test {

class RegistrarDaemon {
public:
    RegistrarDaemon() = default;

    // Starts (or restarts, after stop) the daemon on the fixture's state; false when it does not
    // come up. extra settings are added to the environment.
    bool start(std::vector<std::pair<std::string, std::string>> extra = {});
    // From the next start on: run this binary instead of the built omd (an entitled copy), on this
    // Conduit directory (one that jobd listens in).
    void setExecutable(std::string executable) { m_executable = std::move(executable); }
    void setConduitDirectory(std::string directory) { m_conduitDirectory = std::move(directory); }
    DaemonProcess& daemon() { return *m_daemon; }
    BundleFixture& state() { return m_state; }
    std::string annotationsPath() const { return m_state.root() + "/annotations.vlist"; }
    std::string prefsDirectory() const { return m_state.root() + "/prefs"; }

    // A request over the raw peer; none (with a test failure) when no reply comes.
    Value call(const Value& request);
    Value add(const std::vector<std::string>& paths);
    // Registers the bundles (name -> path) in one "add" and gives each name its UUID; empty, with
    // a test failure, when the daemon refuses.
    std::map<std::string, Uuid> addNamed(const std::map<std::string, std::string>& paths);
    // "match" from the raw peer; the reply with "matches" decoded.
    Value match(const Value& rules, uint64_t flags = 0);

    // Returns once every line the daemon logged for the requests answered so far has been read:
    // the daemon logs a "bulk" request's unknown options, and handles one peer's requests in order.
    void readLogSoFar();

    // The Registrar's database as another process sees it, read-only.
    std::shared_ptr<RegistrarWorkspace> registrar();
    std::optional<Uuid> uuidAt(const std::string& path);

    // A copy of program at path (directories made), carrying entitlements when not none.
    std::string copyProgram(const std::string& program, const std::string& path, const Value& entitlements = Value());
    // Runs an entitled copy of omctl, or any client program, against the daemon.
    ChildProcess::Outcome run(const std::vector<std::string>& arguments);
    // Runs a copy of om_test_client with the request; its reply, with "matches" decoded.
    Value callFrom(const std::string& client, const Value& request);

    static std::string omctlPath();
    static std::string testClientPath();
    static std::string samplesPath();

private:
    BundleFixture m_state;
    std::optional<std::string> m_executable;
    std::optional<std::string> m_conduitDirectory;
    std::unique_ptr<DaemonProcess> m_daemon;
    std::optional<DaemonPeer> m_peer;
    unsigned m_requestFiles = 0;
    uint64_t m_barriers = 0;
};

// Helpers over replies.
uint64_t codeOf(const Value& reply);
std::string errorOf(const Value& reply);
// The "uuid" of every form in a decoded "matches".
std::set<std::string> uuidsIn(const Value& reply);
Value pathsRequest(std::string_view name, const std::vector<std::string>& paths);

} // namespace om::test

// What every omctl subcommand works with: the global options, the output streams, the one
// connection to omd (made on first use) and the mapping of outcomes to exit statuses.
#pragma once

#include <iosfwd>
#include <memory>
#include <string>
#include <string_view>

#include "Ombrel/OMDaemonClient.h"
#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

enum OmctlExitStatus : int {
    kOmctlSuccess = 0,
    kOmctlDaemonError = 1, // omd answered with an error, or what was asked cannot be done
    kOmctlUsage = 2, // bad command line or unreadable input
    kOmctlUnreachable = 3, // no answer: the transport failed
};

class OmctlContext {
public:
    // service empty: the daemon's default service name.
    OmctlContext(std::string service, bool json, std::istream& in, std::ostream& out, std::ostream& err);

    const std::string& service() const { return m_service; }
    bool json() const { return m_json; }
    std::istream& in() { return m_in; }
    std::ostream& out() { return m_out; }
    std::ostream& err() { return m_err; }
    std::string socketPath() const;

    OMDaemonClient& client();

    // Prints "omctl: <message>" and a pointer to the help on stderr; answers kOmctlUsage.
    int usage(std::string_view message);
    // Prints a value on stdout, as JSON with --json and as an outline otherwise.
    void print(const Value& value);
    // Prints "omctl: <command>: <message>" on stderr; answers kOmctlDaemonError, the status of a
    // request that could not be done.
    int failure(std::string_view command, std::string_view message);
    // Sends "match" and reads the reply into records. Says on stderr what went wrong, and which
    // forms did not become records; the exit status, kOmctlSuccess when matches is filled.
    int match(std::string_view command, const Value& rules, uint64_t flags, OMDaemonClient::MatchReply& matches);

    // The exit status of a reply, after saying on stderr what went wrong: kOmctlUnreachable for a
    // transport error, kOmctlDaemonError for an error reply, kOmctlSuccess otherwise.
    int outcome(const Result<Value>& reply);

private:
    std::string m_service;
    bool m_json;
    std::istream& m_in;
    std::ostream& m_out;
    std::ostream& m_err;
    std::shared_ptr<OMDaemonClient> m_client;
};

} // namespace om

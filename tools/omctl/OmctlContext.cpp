#include "tools/omctl/OmctlContext.h"

#include <filesystem>
#include <ostream>

#include "platform/Conduit.h"
#include "platform/Format.h"
#include "tools/omctl/OmctlJson.h"
#include "tools/omctl/OmctlOutput.h"

namespace om {

OmctlContext::OmctlContext(std::string service, bool json, std::istream& in, std::ostream& out, std::ostream& err)
    : m_service(service.empty() ? OMDaemonClient::kDefaultServiceName : std::move(service))
    , m_json(json)
    , m_in(in)
    , m_out(out)
    , m_err(err)
{
}

std::string OmctlContext::socketPath() const
{
    return Conduit::socketPath(m_service);
}

OMDaemonClient& OmctlContext::client()
{
    if (!m_client)
        m_client = OMDaemonClient::initWithServiceName(m_service.c_str());
    return *m_client;
}

int OmctlContext::usage(std::string_view message)
{
    m_err << format("omctl: %s\nTry 'omctl --help' for more information.\n", message);
    return kOmctlUsage;
}

void OmctlContext::print(const Value& value)
{
    if (m_json)
        m_out << OmctlJson::write(value) << '\n';
    else
        m_out << OmctlOutput::tree(value);
    m_out.flush();
}

int OmctlContext::failure(std::string_view command, std::string_view message)
{
    m_err << format("omctl: %s: %s\n", command, message);
    return kOmctlDaemonError;
}

int OmctlContext::match(
    std::string_view command, const Value& rules, uint64_t flags, OMDaemonClient::MatchReply& matches)
{
    OMDaemonClient& omd = client();
    Result<Value> reply = omd.waitForReply([&](auto block) { omd.matchPlugIns(rules, flags, std::move(block)); });
    if (const int status = outcome(reply); status != kOmctlSuccess)
        return status;
    auto read = omd.matchesInReply(reply);
    if (!read.ok())
        return failure(command, read.error().localizedDescription());
    for (const auto& skipped : read->skipped)
        m_err << format(
            "omctl: %s: omd's plug-in %u is unreadable (%s); left out\n", command, skipped.index, skipped.reason);
    matches = std::move(read).releaseValue();
    return kOmctlSuccess;
}

int OmctlContext::outcome(const Result<Value>& reply)
{
    if (!reply.ok()) {
        std::error_code ignored;
        bool listening = std::filesystem::exists(socketPath(), ignored);
        // One write per message: the library may log to stderr from its own thread meanwhile.
        m_err << format("omctl: cannot reach omd at %s: %s%s\n", socketPath(), reply.error().localizedDescription(),
            listening ? "" : " (no socket there)");
        return kOmctlUnreachable;
    }
    // The library treats a message without a code as a broken daemon and aborts; a diagnostic
    // tool reports it instead.
    const Value& answer = reply.value();
    const Value& code = answer["errorcode"];
    bool withoutCode = code.asInt64().value_or(0) == 0 && code.asUInt64().value_or(0) == 0;
    if (const std::string* text = answer.stringFor("error"); text && withoutCode) {
        m_err << format("omctl: omd reported error without a code: %s\n", *text);
        return kOmctlDaemonError;
    }
    if (auto error = OMDaemonClient::errorInReply(reply)) {
        m_err << format("omctl: %s (code %ld)\n", error->localizedDescription(), error->code());
        return kOmctlDaemonError;
    }
    return kOmctlSuccess;
}

} // namespace om

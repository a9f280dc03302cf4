#include "tools/omctl/OmctlReady.h"

#include <future>
#include <ostream>

#include "Ombrel/OMBundle.h"
#include "platform/Conduit.h"
#include "platform/JobManager.h"
#include "tools/omctl/OmctlArguments.h"

namespace om {

const char* const OmctlReady::kReadyHelp = R"(usage: omctl [--service NAME] [--json] ready UUID...

Asks omd to ready the plug-ins for omctl's own process: omd checks that this
host may use each of them, then tells jobd that it may launch them. The grant
lasts as long as this omctl runs, so "ready" alone shows only whether omd
agrees; "launch" readies and launches in one process.
)";

const char* const OmctlReady::kAccessHelp = R"(usage: omctl [--service NAME] [--json] access UUID...

Asks omd for a read-only sandbox extension token for each plug-in's bundle and
prints them, one a line, in the order given.
)";

const char* const OmctlReady::kLaunchHelp = R"(usage: omctl [--service NAME] [--json] launch UUID [LINE]

Readies the plug-in for omctl, launches it through jobd, sends LINE (default
"ping") to the new instance as {"op": LINE} and prints its reply.
)";

namespace {

// The UUID operands; an exit status other than success when there are none or one is malformed.
int uuidOperands(OmctlContext& context, const std::string& command, const std::vector<std::string>& arguments,
    std::vector<Uuid>& uuids)
{
    auto parsed = OmctlArguments::parse(arguments, {});
    if (!parsed.ok())
        return context.usage(command + ": " + parsed.error().localizedDescription());
    for (const std::string& operand : parsed->operands()) {
        auto uuid = Uuid::parse(operand);
        if (!uuid)
            return context.usage(command + ": not a UUID: " + operand);
        uuids.push_back(*uuid);
    }
    if (uuids.empty())
        return context.usage(command + ": give at least one UUID");
    return kOmctlSuccess;
}

using Call = void (OMDaemonClient::*)(const std::vector<Uuid>&, uint64_t, OMDaemonClient::ReplyBlock);

Result<Value> callAndWait(OmctlContext& context, Call call, const std::vector<Uuid>& uuids)
{
    std::promise<Result<Value>> answered;
    (context.client().*call)(uuids, 0, [&answered](const Result<Value>& reply) { answered.set_value(reply); });
    return answered.get_future().get();
}

} // namespace

int OmctlReady::ready(OmctlContext& context, const std::vector<std::string>& arguments)
{
    std::vector<Uuid> uuids;
    if (const int status = uuidOperands(context, "ready", arguments, uuids); status != kOmctlSuccess)
        return status;
    if (const int status = context.outcome(callAndWait(context, &OMDaemonClient::readyPlugIns, uuids));
        status != kOmctlSuccess)
        return status;
    ArrayBuilder readied;
    for (const Uuid& uuid : uuids)
        readied.append(Value::uuid(uuid));
    if (context.json()) {
        context.print(Value::dictionary({ { "readied", readied.build() } }));
        return kOmctlSuccess;
    }
    for (const Uuid& uuid : uuids)
        context.out() << "readied " << uuid.string() << '\n';
    return kOmctlSuccess;
}

int OmctlReady::access(OmctlContext& context, const std::vector<std::string>& arguments)
{
    std::vector<Uuid> uuids;
    if (const int status = uuidOperands(context, "access", arguments, uuids); status != kOmctlSuccess)
        return status;
    const Result<Value> reply = callAndWait(context, &OMDaemonClient::accessPlugIns, uuids);
    if (const int status = context.outcome(reply); status != kOmctlSuccess)
        return status;
    const Value& tokens = reply.value()["extensions"];
    if (context.json()) {
        context.print(Value::dictionary({ { "extensions", tokens } }));
        return kOmctlSuccess;
    }
    for (const Value& token : tokens.elements()) {
        if (const std::string* text = token.asString())
            context.out() << *text << '\n';
    }
    return kOmctlSuccess;
}

int OmctlReady::launch(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, {});
    if (!parsed.ok())
        return context.usage("launch: " + parsed.error().localizedDescription());
    const auto& operands = parsed->operands();
    auto uuid = operands.empty() ? std::nullopt : Uuid::parse(operands[0]);
    if (!uuid || operands.size() > 2)
        return context.usage("launch: give one UUID and at most one LINE");
    const std::string line = operands.size() == 2 ? operands[1] : "ping";

    // The executable is the one omd shows omctl for that UUID.
    OMDaemonClient::MatchReply matches;
    if (const int status = context.match("launch", Value(), 0, matches); status != kOmctlSuccess)
        return status;
    std::optional<std::string> executable;
    for (const auto& matched : matches.matches) {
        if (matched.plugIn->uuid() == uuid && matched.plugIn->path())
            executable = OMBundle::initWithPath(*matched.plugIn->path())->executablePath();
    }
    if (!executable)
        return context.failure("launch", "omd shows omctl no plug-in " + uuid->string() + " with an executable");
    if (const int status = context.outcome(callAndWait(context, &OMDaemonClient::readyPlugIns, { *uuid }));
        status != kOmctlSuccess)
        return status;
    auto launched = JobManagerLaunch(*executable);
    if (!launched.ok())
        return context.failure("launch", launched.error().localizedDescription());

    auto connection = ConduitConnection::adoptSocket(std::move(launched->connection), nullptr);
    connection->setEventHandler([](const ConduitEvent&) {});
    connection->resume();
    std::promise<Result<Value>> answered;
    connection->sendWithReply(Value::dictionary({ { "op", line } }), nullptr,
        [&answered](Result<Value> reply) { answered.set_value(std::move(reply)); });
    const Result<Value> reply = answered.get_future().get();
    connection->cancel();
    if (!reply.ok())
        return context.failure("launch", reply.error().localizedDescription());
    if (context.json())
        context.print(Value::dictionary({ { "pid", launched->pid }, { "reply", reply.value() } }));
    else
        context.out() << "launched " << launched->pid << ": " << reply.value().description() << '\n';
    return kOmctlSuccess;
}

} // namespace om

#include "tools/omctl/OmctlHold.h"

#include <pthread.h>
#include <signal.h>

#include <filesystem>
#include <ostream>

#include "platform/JobManager.h"
#include "tools/omctl/OmctlArguments.h"

namespace om {

const char* const OmctlHold::kHoldHelp
    = R"(usage: omctl [--service NAME] [--json] hold PATH... [--plugins] [--check-busy]
                                           [--terminate] [--wait]

Holds plug-ins: while the hold lasts, hosts neither discover nor ready them.
Each PATH names an application, whose plug-ins are all held, or with
--plugins a plug-in bundle. Prints the hold's token.

  --check-busy  refuse the hold when an instance of a plug-in is busy, and list
                the busy bundle identifiers
  --terminate   have jobd stop the plug-ins' running instances before answering
  --wait        keep the hold until SIGINT (Ctrl-C) or SIGTERM, then release it

omd releases the holds of a client that is gone, so without --wait the hold
ends as omctl exits.
)";

const char* const OmctlHold::kReleaseHelp = R"(usage: omctl [--service NAME] [--json] release TOKEN

Releases the hold named by TOKEN. A token omd does not know is no error.
)";

namespace {

constexpr OmctlArguments::Option kHoldOptions[] = {
    { "--plugins", "", false },
    { "--check-busy", "", false },
    { "--terminate", "", false },
    { "--wait", "", false },
};

uint64_t holdFlags(const OmctlArguments& parsed)
{
    uint64_t flags = 0;
    if (parsed.has("--plugins"))
        flags |= OMDaemonClient::OMLockFlagPlugInPaths;
    if (parsed.has("--check-busy"))
        flags |= OMDaemonClient::OMLockFlagCheckBusy;
    if (parsed.has("--terminate"))
        flags |= OMDaemonClient::OMLockFlagTerminate;
    return flags;
}

int reportConflicts(OmctlContext& context, const Result<Value>& reply)
{
    const int status = context.outcome(reply);
    if (status == kOmctlSuccess || !reply.ok())
        return status;
    for (const Value& conflict : reply.value()["conflicts"].elements()) {
        if (const std::string* identifier = conflict.stringFor(kJobManagerBundleIdentifierKey))
            context.err() << "omctl: hold: busy: " << *identifier << '\n';
    }
    return status;
}

// Parks until SIGINT or SIGTERM, which the caller blocked before any thread started.
void awaitStop(const sigset_t& stop)
{
    int signal = 0;
    while (sigwait(&stop, &signal) != 0) { }
}

} // namespace

int OmctlHold::hold(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, kHoldOptions);
    if (!parsed.ok())
        return context.usage("hold: " + parsed.error().localizedDescription());
    ArrayBuilder paths;
    for (const std::string& operand : parsed->operands()) {
        if (operand.empty())
            return context.usage("hold: empty path");
        std::error_code error;
        auto absolute = std::filesystem::absolute(operand, error);
        paths.append(Value::string(error ? operand : absolute.lexically_normal().string()));
    }
    if (paths.count() == 0)
        return context.usage("hold: give at least one path");

    const bool wait = parsed->has("--wait");
    sigset_t stop;
    sigemptyset(&stop);
    sigaddset(&stop, SIGINT);
    sigaddset(&stop, SIGTERM);
    // Before the connection's threads exist, so that they inherit the mask.
    if (wait) {
        if (const int error = pthread_sigmask(SIG_BLOCK, &stop, nullptr); error != 0)
            return context.failure("hold", OMError::fromErrno("pthread_sigmask", error).localizedDescription());
    }

    OMDaemonClient& client = context.client();
    auto request = client.request("lock", paths.build());
    request.set("flags", Value::unsignedInteger(holdFlags(*parsed)));
    const Result<Value> reply = client.sendSync(request.build());
    if (const int status = reportConflicts(context, reply); status != kOmctlSuccess)
        return status;
    auto token = reply.value()["uuids"].asUuid();
    if (!token)
        return context.failure("hold", "omd answered without a token");
    if (context.json())
        context.print(Value::dictionary({ { "uuid", token->string() } }));
    else
        context.out() << token->string() << '\n';
    context.out().flush(); // a script reads the token while the hold lasts
    if (!wait)
        return kOmctlSuccess;

    awaitStop(stop);
    auto release = client.request("lock");
    OMDaemonClient::set(release, { *token });
    return context.outcome(client.sendSync(release.build()));
}

int OmctlHold::release(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, {});
    if (!parsed.ok())
        return context.usage("release: " + parsed.error().localizedDescription());
    if (parsed->operands().size() != 1)
        return context.usage("release: give one token");
    auto token = Uuid::parse(parsed->operands().front());
    if (!token)
        return context.usage("release: not a token: " + parsed->operands().front());
    OMDaemonClient& client = context.client();
    auto request = client.request("lock");
    OMDaemonClient::set(request, { *token });
    const int status = context.outcome(client.sendSync(request.build()));
    if (status == kOmctlSuccess && !context.json())
        context.out() << "released " << token->string() << '\n';
    return status;
}

} // namespace om

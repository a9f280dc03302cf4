#include "tools/omctl/OmctlRegistration.h"

#include <filesystem>
#include <ostream>

namespace om {

const char* const OmctlRegistration::kAddHelp = R"(usage: omctl [--service NAME] [--json] add PATH...

Registers the plug-in bundles at PATH with omd, in order. A relative PATH is
taken from the current directory. omd stops at the first bundle it refuses;
the bundles before it stay registered.
)";

const char* const OmctlRegistration::kRemoveHelp = R"(usage: omctl [--service NAME] [--json] remove PATH...

Unregisters the plug-in bundles at PATH, in order; a bundle already deleted
from disk can still be unregistered. omd requires the caller to hold the
entitlement com.orvex.private.ombrel.manager, and stops at the first path it
refuses. A relative PATH is taken from the current directory.
)";

namespace {

int sendPaths(OmctlContext& context, const std::vector<std::string>& arguments, std::string_view command,
    std::string_view request, std::string_view done)
{
    ArrayBuilder paths;
    for (const std::string& argument : arguments) {
        if (argument == "--")
            continue;
        if (argument.size() > 1 && argument.starts_with('-'))
            return context.usage(std::string(command) + ": unknown option " + argument);
        if (argument.empty())
            return context.usage(std::string(command) + ": empty path");
        std::error_code error;
        auto absolute = std::filesystem::absolute(argument, error);
        paths.append(Value::string(error ? argument : absolute.lexically_normal().string()));
    }
    if (paths.count() == 0)
        return context.usage(std::string(command) + ": give at least one bundle path");

    Value list = paths.build();
    OMDaemonClient& client = context.client();
    Result<Value> reply = client.sendSync(client.request(request, list).build());
    const int status = context.outcome(reply);
    if (status != kOmctlSuccess)
        return status;
    if (context.json()) {
        context.print(Value::dictionary({ { std::string(done), list } }));
        return status;
    }
    for (const Value& path : list.elements())
        context.out() << done << ' ' << *path.asString() << '\n';
    return status;
}

} // namespace

int OmctlRegistration::add(OmctlContext& context, const std::vector<std::string>& arguments)
{
    return sendPaths(context, arguments, "add", "add", "added");
}

int OmctlRegistration::remove(OmctlContext& context, const std::vector<std::string>& arguments)
{
    return sendPaths(context, arguments, "remove", "remove", "removed");
}

} // namespace om

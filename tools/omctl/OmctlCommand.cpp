#include "tools/omctl/OmctlCommand.h"

#include <algorithm>
#include <iomanip>
#include <optional>
#include <ostream>

#include "platform/Format.h"
#include "tools/omctl/OmctlAnnotation.h"
#include "tools/omctl/OmctlConsent.h"
#include "tools/omctl/OmctlDiagnostics.h"
#include "tools/omctl/OmctlDiscovery.h"
#include "tools/omctl/OmctlHold.h"
#include "tools/omctl/OmctlJobs.h"
#include "tools/omctl/OmctlReady.h"
#include "tools/omctl/OmctlRegistrar.h"
#include "tools/omctl/OmctlRegistration.h"
#include "tools/omctl/OmctlWatch.h"
#include "tools/omctl/OmctlWhy.h"

namespace om {

namespace {

const OmctlCommand::Entry kCommands[] = {
    { "raw", "send a request dictionary (vlist file or JSON) and print the reply", OmctlDiagnostics::kRawHelp,
        OmctlDiagnostics::raw },
    { "ping", "check that omd answers, with the round-trip time", OmctlDiagnostics::kPingHelp, OmctlDiagnostics::ping },
    { "match", "list the plug-ins that rules select, with their elections", OmctlDiscovery::kMatchHelp,
        OmctlDiscovery::match },
    { "elect", "turn the user's election of a plug-in on or off", OmctlAnnotation::kElectHelp, OmctlAnnotation::elect },
    { "annotate", "set annotations of plug-ins", OmctlAnnotation::kAnnotateHelp, OmctlAnnotation::annotate },
    { "why", "explain which rules show or hide a plug-in from a host", OmctlWhy::kHelp, OmctlWhy::why },
    { "watch", "print omd's annotation-change notifications as they come", OmctlWatch::kHelp, OmctlWatch::watch },
    { "add", "register plug-in bundles", OmctlRegistration::kAddHelp, OmctlRegistration::add },
    { "remove", "unregister plug-in bundles", OmctlRegistration::kRemoveHelp, OmctlRegistration::remove },
    { "hold", "hold plug-ins out of discovery, optionally stopping them", OmctlHold::kHoldHelp, OmctlHold::hold },
    { "release", "release a plug-in hold by its token", OmctlHold::kReleaseHelp, OmctlHold::release },
    { "ready", "let omctl's own process launch plug-ins (through jobd)", OmctlReady::kReadyHelp, OmctlReady::ready },
    { "access", "print read tokens for plug-ins' bundles", OmctlReady::kAccessHelp, OmctlReady::access },
    { "launch", "ready a plug-in, launch it through jobd and send it one line", OmctlReady::kLaunchHelp,
        OmctlReady::launch },
    { "ps", "list the plug-in instances jobd is running", OmctlJobs::kPsHelp, OmctlJobs::ps },
    { "consent", "grant, revoke or list an application's privacy consents", OmctlConsent::kHelp,
        OmctlConsent::consent },
    { "registrar", "list registered apps and plug-ins from the Registrar's database", OmctlRegistrar::kHelp,
        OmctlRegistrar::registrar },
};

bool isHelp(std::string_view argument)
{
    return argument == "--help" || argument == "-h";
}

} // namespace

std::span<const OmctlCommand::Entry> OmctlCommand::commands()
{
    return kCommands;
}

void OmctlCommand::printHelp(std::ostream& out)
{
    out << "usage: omctl [--service NAME] [--json] <command> [arguments]\n\n"
           "Talks to omd, the plug-in broker.\n\nCommands:\n";
    for (const Entry& entry : commands())
        out << "  " << std::left << std::setw(10) << entry.name << entry.summary << '\n';
    out << "\nOptions:\n"
           "  --service NAME  the daemon's service name (default com.orvex.ombrel.omd)\n"
           "  --json          print results as JSON\n"
           "  -h, --help      show this help; 'omctl <command> --help' shows a command's\n\n"
           "Exit status: 0 success, 1 omd answered with an error (or what was asked\n"
           "cannot be done), 2 usage error, 3 omd could not be reached.\n\n"
           "omctl reports failures itself; EVLOG_LEVEL=debug (or info, default, error)\n"
           "also shows the client library's log.\n";
}

int OmctlCommand::run(const std::vector<std::string>& arguments, std::istream& in, std::ostream& out, std::ostream& err)
{
    std::string service;
    bool json = false;
    size_t index = 0;
    auto usage = [&err](std::string_view message) {
        err << format("omctl: %s\nTry 'omctl --help' for more information.\n", message);
        return kOmctlUsage;
    };

    for (; index < arguments.size(); ++index) {
        const std::string& argument = arguments[index];
        if (isHelp(argument)) {
            printHelp(out);
            return kOmctlSuccess;
        }
        if (argument == "--json") {
            json = true;
        } else if (argument == "--service") {
            if (index + 1 >= arguments.size() || arguments[index + 1].empty())
                return usage("--service needs a name");
            service = arguments[++index];
        } else if (argument.starts_with("--service=")) {
            service = argument.substr(10);
            if (service.empty())
                return usage("--service needs a name");
        } else if (argument.starts_with("-")) {
            return usage("unknown option " + argument);
        } else {
            break;
        }
    }
    if (index == arguments.size())
        return usage("no command given");

    auto entry = std::find_if(commands().begin(), commands().end(),
        [&](const Entry& candidate) { return candidate.name == arguments[index]; });
    if (entry == commands().end())
        return usage("unknown command " + arguments[index]);

    // "--json" and "--help" are understood after the command too; "--" ends all options.
    std::vector<std::string> rest;
    bool optionsEnded = false;
    for (++index; index < arguments.size(); ++index) {
        const std::string& argument = arguments[index];
        if (!optionsEnded && isHelp(argument)) {
            out << entry->help;
            return kOmctlSuccess;
        }
        if (!optionsEnded && argument == "--json") {
            json = true;
            continue;
        }
        if (argument == "--")
            optionsEnded = true;
        rest.push_back(argument);
    }

    OmctlContext context(service, json, in, out, err);
    return entry->handler(context, rest);
}

} // namespace om

// A sample host: what an application does to use a plug-in, one step a line.
//   sample_host [--plugin IDENTIFIER] [--wait] EXTENSION_POINT [OP]
// It asks omd for the plug-ins of EXTENSION_POINT ("match"), takes the first (or the one named
// IDENTIFIER), asks omd to ready it for this process ("ready", which has jobd record a grant),
// launches it through jobd, sends {"op": OP} (default "ping") on the connection jobd hands over and
// prints the reply. With --wait it keeps the instance running until its standard input closes,
// and says when the instance goes away first. Exit status 0, or 1 with the step that failed, or
// 2 for a usage error.
#include <unistd.h>

#include <cstdio>
#include <future>
#include <iostream>
#include <optional>
#include <string>
#include <vector>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMDaemonClient.h"
#include "platform/Conduit.h"
#include "platform/JobManager.h"

namespace {

struct Options {
    std::string point;
    std::string op = "ping";
    std::optional<std::string> plugIn;
    bool wait = false;
};

void say(const std::string& line)
{
    std::cout << "host: " << line << std::endl; // flushed: a script reads it as it comes
}

int fail(const std::string& line)
{
    std::cerr << "host: " << line << std::endl;
    return 1;
}

std::optional<Options> parse(int argc, char** argv)
{
    Options options;
    std::vector<std::string> operands;
    for (int i = 1; i < argc; ++i) {
        const std::string argument = argv[i];
        if (argument == "--wait")
            options.wait = true;
        else if (argument == "--plugin" && i + 1 < argc)
            options.plugIn = argv[++i];
        else if (argument.starts_with("-"))
            return std::nullopt;
        else
            operands.push_back(argument);
    }
    if (operands.empty() || operands.size() > 2)
        return std::nullopt;
    options.point = operands[0];
    if (operands.size() == 2)
        options.op = operands[1];
    return options;
}

std::string describe(const std::optional<om::OMError>& error)
{
    return error ? error->localizedDescription() : "no reason given";
}

// The plug-in the host will use: the first omd shows it for the point, or the one named.
std::optional<om::OMDaemonClient::MatchedPlugIn> choose(om::OMDaemonClient& omd, const Options& options)
{
    say("asking omd for the plug-ins of " + options.point + " (match)");
    auto reply = omd.matchPlugInsSync(om::Value::dictionary({ { "QSExtensionPointIdentifier", options.point } }), 0);
    if (!reply.ok()) {
        fail("omd could not match: " + reply.error().localizedDescription());
        return std::nullopt;
    }
    say("omd found " + std::to_string(reply->matches.size()) + " plug-in(s)");
    std::optional<om::OMDaemonClient::MatchedPlugIn> chosen;
    for (const auto& matched : reply->matches) {
        const std::string identifier = matched.plugIn->identifier().value_or("?");
        say("  " + identifier + " " + (matched.plugIn->uuid() ? matched.plugIn->uuid()->string() : "?") + " at "
            + matched.plugIn->path().value_or("?"));
        if (!chosen && (!options.plugIn || *options.plugIn == identifier))
            chosen = matched;
    }
    if (!chosen)
        fail("no plug-in to use for " + options.point + (options.plugIn ? " named " + *options.plugIn : ""));
    return chosen;
}

bool ready(om::OMDaemonClient& omd, const om::OMDaemonClient::MatchedPlugIn& chosen)
{
    say("asking omd to ready " + chosen.plugIn->identifier().value_or("?") + " for this host, pid "
        + std::to_string(::getpid()) + " (ready)");
    auto reply = omd.waitForReply([&](auto block) { omd.readyPlugIns({ *chosen.plugIn->uuid() }, 0, block); });
    if (auto error = om::OMDaemonClient::errorInReply(reply)) {
        fail("omd refused to ready it: " + describe(error));
        return false;
    }
    say("omd readied it: jobd now lets this host launch it");
    return true;
}

int talk(const Options& options, om::JobLaunch launched)
{
    say("jobd launched instance pid " + std::to_string(launched.pid) + " of " + launched.bundleIdentifier);
    auto connection = om::ConduitConnection::adoptSocket(std::move(launched.connection), nullptr);
    connection->setEventHandler([waiting = options.wait](const om::ConduitEvent& event) {
        if (event.kind == om::ConduitEvent::Kind::ConnectionInvalid && waiting)
            say("the instance's connection closed: the instance is gone");
    });
    connection->resume();
    say("sending {\"op\": \"" + options.op + "\"} to the instance");
    std::promise<om::Result<om::Value>> answered;
    connection->sendWithReply(om::Value::dictionary({ { "op", options.op } }), nullptr,
        [&answered](om::Result<om::Value> reply) { answered.set_value(std::move(reply)); });
    const om::Result<om::Value> reply = answered.get_future().get();
    if (!reply.ok()) {
        connection->cancel();
        return fail("the instance did not answer: " + reply.error().localizedDescription());
    }
    say("reply: " + reply.value().description());
    if (options.wait) {
        say("keeping the instance until standard input closes");
        for (std::string line; std::getline(std::cin, line);) { }
    }
    connection->setEventHandler([](const om::ConduitEvent&) {});
    connection->cancel();
    say("done");
    return 0;
}

} // namespace

int main(int argc, char** argv)
{
    const auto options = parse(argc, argv);
    if (!options) {
        std::cerr << "usage: sample_host [--plugin IDENTIFIER] [--wait] EXTENSION_POINT [OP]\n";
        return 2;
    }
    auto omd = om::OMDaemonClient::initWithServiceName(nullptr);
    const auto chosen = choose(*omd, *options);
    if (!chosen)
        return 1;
    if (!chosen->plugIn->uuid() || !chosen->plugIn->path())
        return fail("omd sent the plug-in without a UUID or path");
    const auto executable = om::OMBundle::initWithPath(*chosen->plugIn->path())->executablePath();
    if (!executable)
        return fail("the plug-in's bundle names no executable");
    if (!ready(*omd, *chosen))
        return 1;
    say("launching " + *executable + " through jobd");
    auto launched = om::JobManagerLaunch(*executable);
    if (!launched.ok())
        return fail("jobd did not launch it: " + launched.error().localizedDescription());
    return talk(*options, std::move(launched).releaseValue());
}

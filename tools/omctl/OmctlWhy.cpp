#include "tools/omctl/OmctlWhy.h"

#include <algorithm>
#include <ostream>

#include "Ombrel/OMMatcher.h"
#include "platform/Format.h"
#include "platform/Preferences.h"
#include "platform/Registrar.h"
#include "tools/omctl/OmctlArguments.h"
#include "tools/omctl/OmctlDiscovery.h"
#include "tools/omctl/OmctlHost.h"
#include "tools/omctl/OmctlRegistrarPlugIn.h"

namespace om {

const char* const OmctlWhy::kHelp =
    R"(usage: omctl [--service NAME] [--json] why UUID [--host EXECUTABLE | --pid PID] [--database FILE]

Explains which of omd's rules show a plug-in to a host or hide it, in the order
omd applies them: the plug-in's configuration and location, whether it is
dedicated to its own application, the user's exclusions (preference
"exclusions" of domain com.orvex.ombrel.userprefs, under PREFS_DIR), the host's
allowed-plugins entitlement and the entitlement the plug-in requires of its
hosts; then its election, duplicate registrations of its identifier, and
holds. The host is the executable given, or the running process; without
either, a host with no entitlements and no bundle, as omctl itself is.

omctl works this out itself from the Registrar's database, omd's answers to
"match" and the host's executable, and says what it could not check: a hold
shows only as a plug-in omd keeps from omctl with no other rule to explain it,
and duplicates only among the plug-ins omd shows omctl. The host's own match
rules are not known here.

Options:
  --host EXECUTABLE   the host's executable (entitlements and bundle)
  --pid PID           a running host
  -d, --database FILE the Registrar database (default as for 'omctl registrar')
)";

namespace {

constexpr const char* kUserPrefsDomain = "com.orvex.ombrel.userprefs";
constexpr const char* kAllowedPlugInsEntitlement = "com.orvex.developer.ombrel.allowedplugins";

const OmctlArguments::Option kWhyOptions[] = {
    { "--host", "", true },
    { "--pid", "", true },
    { "--database", "-d", true },
};

enum class Outcome : uint8_t { Shows, Hides, Note };

struct Check {
    std::string rule;
    Outcome outcome;
    std::string detail;
};

// What omd's "match" showed omctl of the plug-in and of its identifier.
struct Sightings {
    std::optional<OMDaemonClient::MatchedPlugIn> self; // the plug-in, with every version counted
    bool selfNeededDiscoverAll = false; // seen only with OMDiscoverAll (an entitled omctl)
    std::vector<OMDaemonClient::MatchedPlugIn> winners; // its identifier, one per identifier
    size_t registrations = 0; // its identifier, every version
};

const OMMatcher& matcher()
{
    static const OMMatcher shared([](const OMPlugInCore& plugIn) { return plugIn.annotations(); });
    return shared;
}

std::string uuidOf(const OMDaemonClient::MatchedPlugIn& matched)
{
    return matched.plugIn->uuid()->string();
}

// A match whose failure is no failure of the command: none for any error, which is left unsaid.
std::optional<OMDaemonClient::MatchReply> quietMatch(OMDaemonClient& client, const Value& rules, uint64_t flags)
{
    Result<Value> reply = client.waitForReply([&](auto block) { client.matchPlugIns(rules, flags, std::move(block)); });
    if (!reply.ok() || reply->contains("error"))
        return std::nullopt;
    if (const Value& code = (*reply)["errorcode"]; !code.isNone() && !code.numericallyEquals(0))
        return std::nullopt;
    auto read = client.matchesInReply(reply);
    return read.ok() ? std::optional(std::move(read).releaseValue()) : std::nullopt;
}

int look(OmctlContext& context, const RegistrarPlugInRecord& record, Sightings& seen)
{
    constexpr uint64_t kEvery = OMDaemonClient::OMDiscoverAllVersions | OMDaemonClient::OMDiscoverSameVersions;
    const Value byUuid = Value::dictionary({ { "com.orvex.uuid", Value::string(record.uuid().string()) } });
    OMDaemonClient::MatchReply reply;
    if (const int status = context.match("why", byUuid, kEvery, reply); status != kOmctlSuccess)
        return status;
    if (!reply.matches.empty()) {
        seen.self = reply.matches.front();
    } else if (auto all = quietMatch(context.client(), byUuid, kEvery | OMDaemonClient::OMDiscoverAll)) {
        // Only a manager may ask for everything; for anyone else omd refuses, and that is fine.
        if (!all->matches.empty()) {
            seen.self = all->matches.front();
            seen.selfNeededDiscoverAll = true;
        }
    }
    if (!record.identifier())
        return kOmctlSuccess;
    const Value byIdentifier = Value::dictionary({ { "QSExtensionIdentifier", Value::string(*record.identifier()) } });
    OMDaemonClient::MatchReply winners;
    OMDaemonClient::MatchReply every;
    if (const int status = context.match("why", byIdentifier, 0, winners); status != kOmctlSuccess)
        return status;
    if (const int status = context.match("why", byIdentifier, kEvery, every); status != kOmctlSuccess)
        return status;
    seen.winners = std::move(winners.matches);
    seen.registrations = every.matches.size();
    return kOmctlSuccess;
}

void checkLocation(const OmctlRegistrarPlugIn& plugIn, std::vector<Check>& checks)
{
    if (auto problem = plugIn.diagnose()) {
        checks.push_back({ "configuration", Outcome::Hides,
            "omd ignores mis-configured plug-ins: " + problem->localizedDescription() });
    } else {
        checks.push_back({ "configuration", Outcome::Shows, "well-formed" });
    }
    const auto& app = plugIn.record().containingApp();
    if (app && app->isPlaceholder()) {
        checks.push_back(
            { "location", Outcome::Hides, "its application " + app->path() + " is not completely installed" });
    } else if (plugIn.onSystemVolume()) {
        checks.push_back({ "location", Outcome::Shows, "part of the system (under /System/)" });
    } else if (app) {
        checks.push_back({ "location", Outcome::Shows, "inside the application " + app->path() });
    } else {
        checks.push_back({ "location", Outcome::Hides, "neither part of the system nor inside an application" });
    }
}

void checkDedicated(const OmctlRegistrarPlugIn& plugIn, const OmctlHost& host, std::vector<Check>& checks)
{
    if (!plugIn.isDedicated()) {
        checks.push_back({ "dedicated", Outcome::Shows, "no: any host may see it" });
        return;
    }
    const auto& plugInsPath = host.plugInsPath();
    if (plugInsPath && plugIn.path().value_or(std::string()).starts_with(*plugInsPath))
        checks.push_back({ "dedicated", Outcome::Shows, "yes, and it lives in the host's own " + *plugInsPath });
    else
        checks.push_back({ "dedicated", Outcome::Hides,
            plugInsPath ? "yes, to its own application; the host's plug-ins are in " + *plugInsPath
                        : "yes, to its own application; the host has no application bundle" });
}

void checkExclusions(const OmctlRegistrarPlugIn& plugIn, std::vector<Check>& checks)
{
    Preferences preferences;
    (void)preferences.addSuiteNamed(kUserPrefsDomain); // a constant name, always a file name
    const Value exclusions = preferences.synchronizedValueForKey("exclusions");
    const std::string file = preferences.pathOfDomain(kUserPrefsDomain).value_or(kUserPrefsDomain);
    size_t index = 0;
    for (const Value& pattern : exclusions.elements()) {
        ++index;
        if (pattern.isDictionary() && matcher().match(plugIn, pattern)) {
            checks.push_back({ "user exclusions", Outcome::Hides,
                format("the user's exclusion %u %@ in %s matches it", index, pattern, file) });
            return;
        }
    }
    checks.push_back({ "user exclusions", Outcome::Shows,
        exclusions.isArray() ? format("none of the %u in %s matches it", exclusions.count(), file)
                             : format("%s holds none", file) });
}

// The host's side of the rules, with omd's own wording of each refusal.
void checkHost(const OmctlRegistrarPlugIn& plugIn, const OmctlHost& host, std::vector<Check>& checks)
{
    if (!host.untrustedReason().empty())
        checks.push_back({ "host entitlements", Outcome::Note, host.untrustedReason() });
    const Value allowed = host.entitlementValueForKey(kAllowedPlugInsEntitlement);
    if (allowed.isNone())
        checks.push_back({ "host restriction", Outcome::Shows, "the host may use any plug-in" });
    else if (!allowed.isDictionary())
        checks.push_back({ "host restriction", Outcome::Hides, "invalid host restriction entitlement" });
    else if (!matcher().match(plugIn, allowed))
        checks.push_back(
            { "host restriction", Outcome::Hides, "the host's plug-in entitlement does not allow this plug-in" });
    else
        checks.push_back(
            { "host restriction", Outcome::Shows, format("its allowed-plugins pattern %@ matches", allowed) });

    const Value required = plugIn.pluginKey("QSExtensionHostEntitlement");
    const std::string* name = required.asString();
    if (required.isNone())
        checks.push_back({ "host entitlement", Outcome::Shows, "the plug-in requires none" });
    else if (!name || !host.hasEntitlement(*name))
        checks.push_back(
            { "host entitlement", Outcome::Hides, format("the host does not have the \"%@\" entitlement", required) });
    else
        checks.push_back({ "host entitlement", Outcome::Shows, format("the host has \"%s\"", *name) });
}

void checkElection(const Sightings& seen, std::vector<Check>& checks)
{
    if (!seen.self) {
        checks.push_back({ "election", Outcome::Note, "unknown: omd does not show the plug-in to omctl" });
        return;
    }
    const Value election = seen.self->election();
    const std::string state = election.isNone()
        ? std::string("none made")
        : format("%s (%@)", OmctlDiscovery::electionState(*seen.self), election);
    checks.push_back({ "election", Outcome::Note,
        state + "; it hides nothing by itself, but hosts that ask for QSUserElection see elected plug-ins only" });
}

void checkDuplicates(const RegistrarPlugInRecord& record, const Sightings& seen, std::vector<Check>& checks)
{
    const std::string uuid = record.uuid().string();
    const bool wins
        = std::any_of(seen.winners.begin(), seen.winners.end(), [&](const auto& m) { return uuidOf(m) == uuid; });
    if (!seen.self) {
        checks.push_back({ "duplicates", Outcome::Note, "unknown: omd does not show the plug-in to omctl" });
    } else if (seen.registrations <= 1) {
        checks.push_back({ "duplicates", Outcome::Shows, "it is the only registration of its identifier omctl sees" });
    } else if (wins) {
        checks.push_back({ "duplicates", Outcome::Shows,
            format("it wins over the %u other registration(s) of its identifier", seen.registrations - 1) });
    } else {
        std::string instead;
        for (const auto& winner : seen.winners)
            instead += format(" %s (version %@)", uuidOf(winner), winner.form["version"]);
        checks.push_back({ "duplicates", Outcome::Hides,
            "a newer version or later registration of its identifier is returned instead:" + instead });
    }
}

// A hold is invisible to clients; it shows only as a plug-in omd keeps from omctl without any rule
// checked here that would hide it from omctl.
void checkHold(const OmctlRegistrarPlugIn& plugIn, const Sightings& seen, std::vector<Check>& checks)
{
    if (seen.self && !seen.selfNeededDiscoverAll) {
        checks.push_back({ "hold", Outcome::Shows, "none: omd shows the plug-in to omctl" });
        return;
    }
    std::vector<Check> asOmctl;
    checkLocation(plugIn, asOmctl);
    checkDedicated(plugIn, OmctlHost(), asOmctl);
    checkExclusions(plugIn, asOmctl);
    checkHost(plugIn, OmctlHost(), asOmctl);
    const bool explained
        = std::any_of(asOmctl.begin(), asOmctl.end(), [](const Check& c) { return c.outcome == Outcome::Hides; });
    if (explained)
        checks.push_back({ "hold", Outcome::Note, "unknown: omd keeps the plug-in from omctl for the reasons above" });
    else
        checks.push_back({ "hold", Outcome::Hides,
            "most likely: omd keeps the plug-in from omctl too, though no rule checked here hides it from omctl" });
}

Value checksValue(const std::vector<Check>& checks)
{
    ArrayBuilder list;
    for (const Check& check : checks) {
        const char* outcome = check.outcome == Outcome::Shows ? "shows"
            : check.outcome == Outcome::Hides                 ? "hides"
                                                              : "note";
        list.append(Value::dictionary({ { "rule", check.rule }, { "outcome", outcome }, { "detail", check.detail } }));
    }
    return list.build();
}

void print(
    OmctlContext& context, const OmctlRegistrarPlugIn& plugIn, const OmctlHost& host, const std::vector<Check>& checks)
{
    auto hidden
        = std::find_if(checks.begin(), checks.end(), [](const Check& c) { return c.outcome == Outcome::Hides; });
    const std::string verdict = hidden == checks.end()
        ? std::string("omd shows it to this host when the host's own rules select it")
        : "hidden from this host by the " + hidden->rule + " rule: " + hidden->detail;
    const Value version = plugIn.attribute("QSExtensionVersion");
    if (context.json()) {
        context.print(Value::dictionary(
            { { "uuid", Value::uuid(*plugIn.uuid()) }, { "identifier", plugIn.identifier().value_or("") },
                { "version", version }, { "path", plugIn.path().value_or("") }, { "host", host.description() },
                { "checks", checksValue(checks) }, { "visible", hidden == checks.end() }, { "verdict", verdict } }));
        return;
    }
    std::ostream& out = context.out();
    out << format("plug-in %s %s %@\n  at %s\nhost: %s\n", plugIn.uuid()->string(), plugIn.identifier().value_or("-"),
        version, plugIn.path().value_or("-"), host.description());
    for (const Check& check : checks) {
        const char* outcome = check.outcome == Outcome::Shows ? "shows "
            : check.outcome == Outcome::Hides                 ? "HIDES "
                                                              : "note  ";
        out << "  " << outcome << check.rule << ": " << check.detail << '\n';
    }
    out << "verdict: " << verdict << '\n';
}

} // namespace

int OmctlWhy::why(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, kWhyOptions);
    if (!parsed.ok())
        return context.usage("why: " + parsed.error().localizedDescription());
    const auto uuid = parsed->operands().size() == 1 ? Uuid::parse(parsed->operands().front()) : std::nullopt;
    if (!uuid)
        return context.usage("why: give one plug-in UUID");
    if (parsed->has("--host") && parsed->has("--pid"))
        return context.usage("why: give --host or --pid, not both");

    Result<OmctlHost> host = OmctlHost();
    if (auto executable = parsed->value("--host")) {
        host = OmctlHost::forExecutable(*executable);
    } else if (auto pid = parsed->value("--pid")) {
        auto number = OmctlArguments::number(*pid);
        if (!number || *number == 0 || *number > uint64_t(INT32_MAX))
            return context.usage("why: --pid needs a process id");
        host = OmctlHost::forProcess(static_cast<pid_t>(*number));
    }
    if (!host.ok())
        return context.failure("why", host.error().localizedDescription());

    auto configuration = RegistrarWorkspace::Configuration::fromEnvironment();
    if (auto database = parsed->value("--database"))
        configuration.databasePath = *database;
    auto workspace = RegistrarWorkspace::open(configuration, RegistrarWorkspace::Access::ReadOnly);
    if (!workspace.ok())
        return context.failure("why", workspace.error().localizedDescription());
    auto record = workspace.value()->plugInWithUuid(*uuid);
    if (!record)
        return context.failure(
            "why", format("no plug-in %s in the Registrar database %s", uuid->string(), configuration.databasePath));

    Sightings seen;
    if (const int status = look(context, *record, seen); status != kOmctlSuccess)
        return status;
    auto plugIn = OmctlRegistrarPlugIn::create(record, seen.self ? seen.self->plugIn->annotations() : Value());
    if (!plugIn)
        return context.failure("why", "the Registrar's record of " + uuid->string() + " cannot be read as a plug-in");

    std::vector<Check> checks;
    checkLocation(*plugIn, checks);
    checkDedicated(*plugIn, host.value(), checks);
    checkExclusions(*plugIn, checks);
    checkHost(*plugIn, host.value(), checks);
    checkElection(seen, checks);
    checkDuplicates(*record, seen, checks);
    checkHold(*plugIn, seen, checks);
    print(context, *plugIn, host.value(), checks);
    return kOmctlSuccess;
}

} // namespace om

#include "tools/omctl/OmctlDiscovery.h"

#include <algorithm>
#include <ostream>

#include "platform/Format.h"
#include "tools/omctl/OmctlArguments.h"
#include "tools/omctl/OmctlJson.h"

namespace om {

const char* const OmctlDiscovery::kMatchHelp =
    R"(usage: omctl [--service NAME] [--json] match [KEY=PATTERN ...] [--json-rules JSON] [--flags N]

Asks omd which plug-ins the rules select and prints them: UUID, identifier,
version, election (on, off, or - when none was made) and bundle path, sorted by
identifier. omd answers as it answers any host: omctl's own process is the
host, so plug-ins dedicated to an application, held ones and ones that need a
host entitlement omctl lacks are not shown (see 'omctl why').

Each KEY=PATTERN is one rule with a string pattern, for example
  omctl match QSExtensionPointIdentifier=com.orvex.share 'QSExtensionVersion=>=2'
Patterns may start with an operator (=, <>, <, <=, >, >=, ?TY-CONFORMS:, ?TY-IS:);
text without one must be equal. --json-rules gives the whole rule dictionary
as a JSON object (see 'omctl raw --help' for the notation), for rules that are
not strings: --json-rules '{"QSUserElection": ["1"], "Dedicated": false}'.
KEY=PATTERN rules are added to it. Without rules every plug-in is a candidate.

Options:
  --json-rules JSON   the rules as a JSON object
  -f, --flags N       discovery flags, decimal or 0x hexadecimal: 0x1 every
                      version, 0x4 (with 0x1) equal versions too, 0x8 only
                      plug-ins of the system, 0x200 everything (omd allows it
                      only to a manager)
--json prints the plug-ins' forms as omd sent them.
)";

namespace {

const OmctlArguments::Option kMatchOptions[] = {
    { "--json-rules", "", true },
    { "--flags", "-f", true },
};

// The rules of the command line; none when there are none. Fails with a usage message.
Result<Value> rulesFrom(const OmctlArguments& arguments)
{
    DictionaryBuilder rules;
    if (auto json = arguments.value("--json-rules")) {
        Result<Value> parsed = OmctlJson::parse(*json);
        if (!parsed.ok())
            return OMError("omctl", 0, "--json-rules: " + parsed.error().localizedDescription());
        if (!parsed->isDictionary())
            return OMError("omctl", 0, "--json-rules needs a JSON object");
        rules = DictionaryBuilder(parsed.value());
    }
    for (const std::string& operand : arguments.operands()) {
        const auto equals = operand.find('=');
        if (equals == std::string::npos || equals == 0)
            return OMError("omctl", 0, "a rule is KEY=PATTERN, not " + operand);
        rules.set(operand.substr(0, equals), Value::string(operand.substr(equals + 1)));
    }
    if (rules.count() == 0 && !arguments.has("--json-rules"))
        return Value();
    return rules.build();
}

std::string textOf(const Value& value)
{
    const std::string* text = value.asString();
    return text ? *text : value.isNone() ? std::string("-") : value.description();
}

void printTable(std::ostream& out, const std::vector<OMDaemonClient::MatchedPlugIn>& matches)
{
    std::vector<std::vector<std::string>> rows = { { "UUID", "IDENTIFIER", "VERSION", "ELECTION", "PATH" } };
    for (const auto& matched : matches) {
        const auto& plugIn = *matched.plugIn;
        rows.push_back({ plugIn.uuid()->string(), plugIn.identifier().value_or("-"), textOf(matched.form["version"]),
            OmctlDiscovery::electionState(matched), plugIn.path().value_or("-") });
    }
    std::vector<size_t> widths(rows.front().size(), 0);
    for (const auto& row : rows) {
        for (size_t column = 0; column < row.size(); ++column)
            widths[column] = std::max(widths[column], row[column].size());
    }
    for (const auto& row : rows) {
        std::string line;
        for (size_t column = 0; column < row.size(); ++column) {
            line += row[column];
            if (column + 1 < row.size())
                line.append(widths[column] - row[column].size() + 2, ' ');
        }
        out << line << '\n';
    }
}

} // namespace

std::string OmctlDiscovery::electionState(const OMDaemonClient::MatchedPlugIn& matched)
{
    if (matched.election().isNone())
        return "-";
    return matched.elected() ? "on" : "off";
}

int OmctlDiscovery::match(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, kMatchOptions);
    if (!parsed.ok())
        return context.usage("match: " + parsed.error().localizedDescription());
    uint64_t flags = 0;
    if (auto text = parsed->value("--flags")) {
        auto number = OmctlArguments::number(*text);
        if (!number)
            return context.usage("match: --flags needs a number, decimal or 0x hexadecimal");
        flags = *number;
    }
    Result<Value> rules = rulesFrom(parsed.value());
    if (!rules.ok())
        return context.usage("match: " + rules.error().localizedDescription());

    OMDaemonClient::MatchReply reply;
    if (const int status = context.match("match", rules.value(), flags, reply); status != kOmctlSuccess)
        return status;
    auto& matches = reply.matches;
    std::stable_sort(matches.begin(), matches.end(), [](const auto& a, const auto& b) {
        return std::pair(a.plugIn->identifier(), a.plugIn->path())
            < std::pair(b.plugIn->identifier(), b.plugIn->path());
    });
    if (context.json()) {
        ArrayBuilder forms;
        for (const auto& matched : matches)
            forms.append(matched.form);
        context.print(forms.build());
    } else if (matches.empty()) {
        context.out() << "no plug-in matches\n";
    } else {
        printTable(context.out(), matches);
    }
    return kOmctlSuccess;
}

int OmctlDiscovery::resolve(OmctlContext& context, std::string_view command, const std::string& target, Uuid& uuid)
{
    if (auto parsed = Uuid::parse(target)) {
        uuid = *parsed;
        return kOmctlSuccess;
    }
    OMDaemonClient::MatchReply reply;
    const Value rules = Value::dictionary({ { "QSExtensionIdentifier", Value::string(target) } });
    const uint64_t every = OMDaemonClient::OMDiscoverAllVersions | OMDaemonClient::OMDiscoverSameVersions;
    if (const int status = context.match(command, rules, every, reply); status != kOmctlSuccess)
        return status;
    if (reply.matches.empty())
        return context.failure(command, format("no plug-in with identifier %s is visible to omctl", target));
    if (reply.matches.size() > 1) {
        std::string uuids;
        for (const auto& matched : reply.matches)
            uuids += format("\n  %s %s %s", matched.plugIn->uuid()->string(), textOf(matched.form["version"]),
                matched.plugIn->path().value_or("-"));
        return context.failure(command,
            format("identifier %s is ambiguous: %u plug-ins have it; give one of their UUIDs:%s", target,
                reply.matches.size(), uuids));
    }
    uuid = *reply.matches.front().plugIn->uuid();
    return kOmctlSuccess;
}

} // namespace om

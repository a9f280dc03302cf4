#include "tools/omctl/OmctlAnnotation.h"

#include <ostream>

#include "platform/Format.h"
#include "tools/omctl/OmctlArguments.h"
#include "tools/omctl/OmctlDiscovery.h"
#include "tools/omctl/OmctlJson.h"

namespace om {

const char* const OmctlAnnotation::kElectHelp
    = R"(usage: omctl [--service NAME] [--json] elect (UUID | IDENTIFIER) (on | off)

Records the user's election of a plug-in: on enables it (election 1), off
withdraws it (election 0). Hosts that ask for elected plug-ins only
(QSUserElection) see the change at their next discovery; omd tells them with
the notification com.orvex.ombrel.annotation-change. Plug-ins that share an
annotation (every version of one identifier) share the election.

An IDENTIFIER must name exactly one plug-in that omd shows omctl, counting
every version; otherwise give the UUID ('omctl match' lists them).
)";

const char* const OmctlAnnotation::kAnnotateHelp =
    R"(usage: omctl [--service NAME] [--json] annotate UUID... KEY=JSONVALUE...
       omctl [--service NAME] [--json] annotate --bulk UUID=JSONOBJECT...

Sets annotations of plug-ins. Each KEY=JSONVALUE is one annotation, its value
JSON ('omctl raw --help' shows the notation); every UUID gets the same change:
  omctl annotate 6BA7B810-9DAD-11D1-80B4-00C04FD430C8 election=1 'extension={"pinned": true}'
omd keeps two annotations: election (a number) and extension (a dictionary,
replaced whole). It ignores other keys. omd changes the plug-ins in order and
stops at the first UUID it does not know; those before it keep their change.

--bulk replaces the extension dictionary of each plug-in with its own object,
and leaves elections alone:
  omctl annotate --bulk 6BA7B810-9DAD-11D1-80B4-00C04FD430C8='{"pinned": true}'

Options:
  --bulk   one extension dictionary per UUID
)";

namespace {

const OmctlArguments::Option kAnnotateOptions[] = { { "--bulk", "", false } };

int send(OmctlContext& context, const Value& request)
{
    return context.outcome(context.client().sendSync(request));
}

// KEY=JSONVALUE into key and value; fails with a usage message.
Result<Value::Entry> assignment(const std::string& operand)
{
    const auto equals = operand.find('=');
    if (equals == std::string::npos || equals == 0)
        return OMError("omctl", 0, "expected KEY=JSONVALUE, not " + operand);
    Result<Value> value = OmctlJson::parse(std::string_view(operand).substr(equals + 1));
    if (!value.ok())
        return OMError("omctl", 0, operand.substr(0, equals) + ": " + value.error().localizedDescription());
    return Value::Entry(operand.substr(0, equals), value.value());
}

int bulkAnnotate(OmctlContext& context, const std::vector<std::string>& operands)
{
    DictionaryBuilder annotations;
    for (const std::string& operand : operands) {
        auto entry = assignment(operand);
        if (!entry.ok())
            return context.usage("annotate: " + entry.error().localizedDescription());
        // Keys and values go as given: omd says which of them it refuses, and why.
        annotations.set(entry->first, entry->second);
    }
    if (annotations.count() == 0)
        return context.usage("annotate: --bulk needs at least one UUID=JSONOBJECT");
    const Value changes = annotations.build();
    OMDaemonClient& client = context.client();
    Value request = client.request("bulk-annotate").set("annotations", changes).build();
    if (const int status = send(context, request); status != kOmctlSuccess)
        return status;
    if (context.json())
        context.print(Value::dictionary({ { "annotated", changes } }));
    else
        for (const auto& [uuid, extension] : changes.entries())
            context.out() << "annotated " << uuid << '\n';
    return kOmctlSuccess;
}

} // namespace

int OmctlAnnotation::elect(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, {});
    if (!parsed.ok())
        return context.usage("elect: " + parsed.error().localizedDescription());
    const auto& operands = parsed->operands();
    if (operands.size() != 2 || (operands[1] != "on" && operands[1] != "off"))
        return context.usage("elect: give a UUID or an identifier, then on or off");

    Uuid uuid;
    if (const int status = OmctlDiscovery::resolve(context, "elect", operands[0], uuid); status != kOmctlSuccess)
        return status;
    const bool on = operands[1] == "on";
    OMDaemonClient& client = context.client();
    auto request = client.request("annotate");
    OMDaemonClient::set(request, { uuid });
    request.set("annotations", Value::dictionary({ { "election", on ? 1 : 0 } }));
    if (const int status = send(context, request.build()); status != kOmctlSuccess)
        return status;
    if (context.json())
        context.print(Value::dictionary({ { "uuid", Value::uuid(uuid) }, { "election", on ? 1 : 0 } }));
    else
        context.out() << (on ? "elected " : "unelected ") << uuid.string() << '\n';
    return kOmctlSuccess;
}

int OmctlAnnotation::annotate(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, kAnnotateOptions);
    if (!parsed.ok())
        return context.usage("annotate: " + parsed.error().localizedDescription());
    if (parsed->has("--bulk"))
        return bulkAnnotate(context, parsed->operands());

    std::vector<Uuid> uuids;
    DictionaryBuilder annotations;
    for (const std::string& operand : parsed->operands()) {
        if (operand.find('=') == std::string::npos) {
            auto uuid = Uuid::parse(operand);
            if (!uuid)
                return context.usage("annotate: not a UUID: " + operand);
            uuids.push_back(*uuid);
            continue;
        }
        auto entry = assignment(operand);
        if (!entry.ok())
            return context.usage("annotate: " + entry.error().localizedDescription());
        if (entry->first != "election" && entry->first != "extension")
            context.err() << format(
                "omctl: annotate: omd keeps only election and extension; %s is ignored\n", entry->first);
        annotations.set(entry->first, entry->second);
    }
    if (uuids.empty() || annotations.count() == 0)
        return context.usage("annotate: give at least one UUID and one KEY=JSONVALUE");

    const Value change = annotations.build();
    OMDaemonClient& client = context.client();
    Result<Value> reply = client.waitForReply(
        [&](OMDaemonClient::ReplyBlock block) { client.setPluginAnnotations(uuids, change, std::move(block)); });
    if (const int status = context.outcome(reply); status != kOmctlSuccess)
        return status;
    if (context.json()) {
        ArrayBuilder list;
        for (const Uuid& uuid : uuids)
            list.append(Value::uuid(uuid));
        context.print(Value::dictionary({ { "annotated", list.build() }, { "annotations", change } }));
        return kOmctlSuccess;
    }
    for (const Uuid& uuid : uuids)
        context.out() << "annotated " << uuid.string() << '\n';
    return kOmctlSuccess;
}

} // namespace om

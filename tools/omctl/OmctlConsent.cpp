#include "tools/omctl/OmctlConsent.h"

#include <ostream>

#include "platform/Consent.h"
#include "tools/omctl/OmctlArguments.h"

namespace om {

const char* const OmctlConsent::kHelp = R"(usage: omctl [--json] consent (grant | revoke) BUNDLE SERVICE
       omctl [--json] consent list BUNDLE [SERVICE]

Records or lists the user's privacy-consent grants to the application whose
bundle identifier is BUNDLE. "grant" and "revoke" set SERVICE's flag (a revoked
service stays listed, as not granted); "list" prints each recorded service
with "granted" or "denied", only SERVICE's when given. The store is CONSENT_DB
and is made by the first grant or revoke. omd reads it when it readies a
plug-in of the application: a keyboard that asks for open access runs in the
full plug-in sandbox only with com.orvex.consent.keyboard-network granted.
)";

namespace {

int list(OmctlContext& context, const std::string& bundle, const std::string* service)
{
    auto entries = Consent::informationForBundle(Consent::defaultPath(), bundle);
    if (!entries.ok())
        return context.failure("consent", entries.error().localizedDescription());
    DictionaryBuilder found;
    for (const auto& entry : *entries) {
        if (!service || entry.service == *service)
            found.set(entry.service, entry.granted);
    }
    const Value grants = found.build();
    if (context.json()) {
        context.print(Value::dictionary({ { bundle, grants } }));
        return kOmctlSuccess;
    }
    for (const auto& [name, granted] : grants.entries())
        context.out() << name << ' ' << (granted.asBool().value_or(false) ? "granted" : "denied") << '\n';
    return kOmctlSuccess;
}

} // namespace

int OmctlConsent::consent(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, {});
    if (!parsed.ok())
        return context.usage("consent: " + parsed.error().localizedDescription());
    const auto& operands = parsed->operands();
    if (operands.empty())
        return context.usage("consent: give grant, revoke or list");
    const std::string& action = operands[0];
    if (action == "list") {
        if (operands.size() < 2 || operands.size() > 3 || operands[1].empty())
            return context.usage("consent: list needs BUNDLE and at most one SERVICE");
        return list(context, operands[1], operands.size() == 3 ? &operands[2] : nullptr);
    }
    if (action != "grant" && action != "revoke")
        return context.usage("consent: unknown action " + action);
    if (operands.size() != 3 || operands[1].empty() || operands[2].empty())
        return context.usage("consent: " + action + " needs BUNDLE and SERVICE");

    auto store = Consent::open(Consent::defaultPath(), Consent::Access::ReadWrite);
    if (!store.ok())
        return context.failure("consent", store.error().localizedDescription());
    const bool granted = action == "grant";
    if (auto recorded = (*store)->set(operands[1], operands[2], granted); !recorded.ok())
        return context.failure("consent", recorded.error().localizedDescription());
    if (context.json())
        context.print(Value::dictionary({ { operands[1], Value::dictionary({ { operands[2], granted } }) } }));
    else
        context.out() << (granted ? "granted " : "revoked ") << operands[2] << " to " << operands[1] << '\n';
    return kOmctlSuccess;
}

} // namespace om

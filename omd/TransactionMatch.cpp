// "match": the plug-ins a host may see and use among those its rules select, one per identifier
// unless it asks for every version, each in its wire form with its annotations and resource tokens.
#include "Ombrel/OMBundle.h"
#include "Ombrel/OMDaemonClient.h"
#include "Ombrel/OMLog.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDMatchResults.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDServer.h"
#include "omd/OMDUserPrefs.h"
#include "omd/Transaction.h"
#include "platform/Probes.h"
#include "platform/Process.h"

namespace om {

namespace {

constexpr uint64_t kDiscoverSystemOnly = 0x8;
constexpr uint64_t kDiscoverAll = 0x200;
constexpr const char* kManagerEntitlement = "com.orvex.private.ombrel.manager";
constexpr const char* kReplacePluginEntitlement = "com.orvex.developer.replace-plugin";

} // namespace

void Transaction::addAnnotationForPlugIn(const OMDPlugIn& plugIn, DictionaryBuilder& form)
{
    Value annotation = server()->annotationForPlugIn(plugIn);
    form.set("annotations", annotation.isNone() ? Value::dictionary({}) : annotation);
}

bool Transaction::excluded(const OMDPlugIn& plugIn, const Value& exclusions) const
{
    for (const Value& exclusion : exclusions.elements()) {
        if (exclusion.isDictionary() && plugIn.match(exclusion)) {
            OMLog::ops().debug("client %d plugin %{public}@ globally excluded", m_client->pid(),
                Value::uuid(plugIn.registrationUuid()));
            return true;
        }
    }
    return false;
}

bool Transaction::visibleToClient(const std::shared_ptr<OMDPlugIn>& plugIn, uint64_t flags) const
{
    if (!plugIn->onSystemVolume() && (!plugIn->containingUrl() || (flags & kDiscoverSystemOnly)))
        return false;
    if (plugIn->isDedicated()) {
        const auto& bundle = m_client->bundle();
        auto plugInsPath = bundle ? bundle->plugInsPath() : std::nullopt;
        if (!plugInsPath || !plugIn->path().value_or(std::string()).starts_with(*plugInsPath))
            return false;
    }
    return !server()->holdOnPlugIn(plugIn);
}

void Transaction::matchPlugIns()
{
    const Value& rulesValue = m_request["rules"];
    if (!rulesValue.isNone() && !rulesValue.isDictionary())
        return fail(4, "invalid request format (bad rules dictionary)");
    const uint64_t flags = m_request["flags"].asUInt64().value_or(0);
    const bool all = (flags & kDiscoverAll) != 0;
    if (all && (!m_client->hasEntitlement(kManagerEntitlement) || m_client->isSandboxed()))
        return fail(11, "unauthorized discovery flag (OMDiscoverAll)");

    const Value exclusions = server()->userPrefs().exclusions();
    auto candidates = server()->findPlugIns(rulesValue);
    const size_t candidateCount = candidates ? candidates->size() : 0;
    OM_PROBE1(discover__raw, static_cast<unsigned>(candidateCount));

    OMDMatchResults results(flags);
    for (const auto& plugIn : candidates.value_or(OMDPlugIns {})) {
        if (!all && !visibleToClient(plugIn, flags))
            continue;
        if (!plugIn->match(rulesValue) || excluded(*plugIn, exclusions))
            continue;
        if (!all) {
            if (auto reason = plugIn->allowForClient(*m_client)) {
                OMLog::ops().debug("client %d cannot use plugin %{public}@: %{public}@", m_client->pid(),
                    Value::uuid(plugIn->registrationUuid()), *reason);
                continue;
            }
        }
        std::optional<OMError> exportError;
        Value form = plugIn->exportForm(&exportError);
        if (exportError) {
            OMLog::ops().error("failed to export matching plug-in %{public}@: %{public}@",
                Value::uuid(plugIn->registrationUuid()), exportError->localizedDescription());
        }
        if (form.isNone() || !results.admit(form))
            continue;
        DictionaryBuilder completed(form);
        addAnnotationForPlugIn(*plugIn, completed);
        plugIn->augmentForm(completed);
        results.append(std::move(completed), plugIn->valueForEntitlement(kReplacePluginEntitlement));
    }

    const Value matches = results.finish();
    OMLog::ops().info("match returned %u plug-ins", static_cast<unsigned>(matches.elements().size()));
    if (auto encoded = OMDaemonClient::convertToConduit(matches, static_cast<int64_t>(m_version)))
        m_reply.set("matches", std::move(*encoded));
    OMLog::ops().debug("reply marshalled");
    done();
}

} // namespace om

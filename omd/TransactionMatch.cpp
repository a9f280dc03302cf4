// "match": the plug-ins a host may see and use among those its rules select, one per identifier
// unless it asks for every version, each in its wire form with its annotations and resource tokens.
#include <unordered_map>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMDaemonClient.h"
#include "Ombrel/OMLog.h"
#include "Ombrel/OMVersionString.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDServer.h"
#include "omd/OMDUserPrefs.h"
#include "omd/Transaction.h"
#include "platform/Probes.h"
#include "platform/Process.h"

namespace om {

namespace {

constexpr uint64_t kDiscoverAllVersions = 0x1;
constexpr uint64_t kDiscoverSameVersions = 0x4;
constexpr uint64_t kDiscoverSystemOnly = 0x8;
constexpr uint64_t kDiscoverAll = 0x200;
constexpr const char* kManagerEntitlement = "com.orvex.private.ombrel.manager";
constexpr const char* kReplacePluginEntitlement = "com.orvex.developer.replace-plugin";

// One form of the reply being built, with what duplicate resolution and overrides read of it.
struct Found {
    DictionaryBuilder form;
    std::string identifier;
    std::string uuid;
    Value version;
    bool systemResident = false;
    int64_t lastModified = 0;
    bool removed = false;
};

std::string text(const Value& value)
{
    const std::string* string = value.asString();
    return string ? *string : std::string();
}

bool preferred(const OMDPlugIn& plugIn, const Found& existing)
{
    if (plugIn.onSystemVolume() && !existing.systemResident)
        return true;
    return int64_t(plugIn.lastModified()) > existing.lastModified;
}

enum class Outcome : uint8_t { KeepBoth, DropNew, ReplaceExisting };

// The duplicate-resolution table for a new plug-in against an existing form of its identifier.
Outcome resolve(const OMDPlugIn& plugIn, const Found& existing, uint64_t flags)
{
    const int order = compareVersionString(text(plugIn.version()), text(existing.version));
    const bool allVersions = (flags & kDiscoverAllVersions) != 0;
    if (allVersions && (order != 0 || (flags & kDiscoverSameVersions)))
        return Outcome::KeepBoth;
    if (!allVersions && order != 0)
        return order > 0 ? Outcome::ReplaceExisting : Outcome::DropNew;
    return preferred(plugIn, existing) ? Outcome::ReplaceExisting : Outcome::DropNew;
}

} // namespace

void Transaction::addAnnotationForPlugIn(const OMDPlugIn& plugIn, DictionaryBuilder& form)
{
    Value annotation = server()->annotationForPlugIn(plugIn);
    form.set("annotations", annotation.isNone() ? Value::dictionary({}) : annotation);
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

    const pid_t pid = m_client->pid();
    const Value exclusions = server()->userPrefs().exclusions();
    auto candidates = server()->findPlugIns(rulesValue);
    const size_t candidateCount = candidates ? candidates->size() : 0;
    OM_PROBE1(discover__raw, static_cast<unsigned>(candidateCount));

    std::vector<Found> found;
    std::unordered_map<std::string, size_t> overrides; // identifier -> index into found
    for (const auto& plugIn : candidates.value_or(OMDPlugIns {})) {
        if (!all && !visibleToClient(plugIn, flags))
            continue;
        if (!plugIn->match(rulesValue))
            continue;
        bool excluded = false;
        for (const Value& exclusion : exclusions.elements()) {
            if (exclusion.isDictionary() && plugIn->match(exclusion)) {
                OMLog::ops().debug(
                    "client %d plugin %{public}@ globally excluded", pid, Value::uuid(plugIn->registrationUuid()));
                excluded = true;
                break;
            }
        }
        if (excluded)
            continue;
        if (!all) {
            if (auto reason = plugIn->allowForClient(*m_client)) {
                OMLog::ops().debug("client %d cannot use plugin %{public}@: %{public}@", pid,
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
        if (form.isNone())
            continue;

        bool keep = true;
        for (auto& existing : found) {
            if (existing.removed || existing.identifier != text(form["identifier"]))
                continue;
            const Outcome outcome = resolve(*plugIn, existing, flags);
            if (outcome == Outcome::KeepBoth)
                continue;
            if (outcome == Outcome::DropNew)
                keep = false;
            else
                existing.removed = true;
            break;
        }
        if (!keep)
            continue;

        Found entry { DictionaryBuilder(form), text(form["identifier"]), text(form["uuid"]), form["version"],
            form["systemResident"].asBool().value_or(false), form["lastmodified"].asInt64().value_or(0) };
        addAnnotationForPlugIn(*plugIn, entry.form);
        plugIn->augmentForm(entry.form);
        found.push_back(std::move(entry));
        const Value replaced = plugIn->valueForEntitlement(kReplacePluginEntitlement);
        if (const std::string* name = replaced.asString())
            overrides[*name] = found.size() - 1;
        for (const Value& element : replaced.elements()) {
            if (const std::string* name = element.asString())
                overrides[*name] = found.size() - 1;
        }
    }

    // Overrides name the replaced plug-in's form after its replacement, and the other way round. A
    // replacement that duplicate resolution took out again still names what it replaces.
    for (auto& form : found) {
        if (form.removed)
            continue;
        auto overrider = overrides.find(form.identifier);
        if (overrider == overrides.end())
            continue;
        Found& replacing = found[overrider->second];
        form.form.set("overrider", Value::string(replacing.uuid));
        replacing.form.set("overriding", Value::string(form.identifier));
        OMLog::ops().info("plug-in %{public}@ overrides %{public}@", replacing.uuid, form.uuid);
    }

    ArrayBuilder matches;
    for (auto& form : found) {
        if (!form.removed)
            matches.append(form.form.build());
    }
    OMLog::ops().info("match returned %u plug-ins", static_cast<unsigned>(matches.count()));
    if (auto encoded = OMDaemonClient::convertToConduit(matches.build(), static_cast<int64_t>(m_version)))
        m_reply.set("matches", std::move(*encoded));
    OMLog::ops().debug("reply marshalled");
    done();
}

} // namespace om

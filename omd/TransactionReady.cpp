// "ready" and "access": preparing named plug-ins for the requesting host. "ready" lets the host
// launch them through the job manager; "access" hands it read tokens for their bundles.
#include <cerrno>
#include <unordered_set>
#include <vector>

#include "Ombrel/OMLog.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDServer.h"
#include "omd/Transaction.h"
#include "platform/Format.h"
#include "platform/Probes.h"
#include "platform/Sandbox.h"

namespace om {

namespace {

constexpr const char* kOnHoldReason = "the plug-in is on hold";

} // namespace

void Transaction::readyPlugIns()
{
    const pid_t pid = m_client->pid();
    // Each plug-in once, in the order first listed. Nothing is enabled until every listed plug-in
    // has passed, so a refused request leaves the job manager untouched.
    std::vector<std::shared_ptr<OMDPlugIn>> toReady;
    std::unordered_set<std::shared_ptr<OMDPlugIn>, OMPlugInCore::Hash, OMPlugInCore::Equal> seen;

    const bool completed = processUuidList([&](const std::shared_ptr<OMDPlugIn>& plugIn) {
        const Value uuid = Value::uuid(plugIn->registrationUuid());
        const Value identifier = Value::string(plugIn->identifier().value_or(std::string()));
        if (OM_PROBE_ENABLED(plugin__ready)) {
            const std::string text = plugIn->registrationUuid().string();
            OM_PROBE1(plugin__ready, text.c_str());
        }
        if (server()->holdOnPlugIn(plugIn)) {
            OMLog::ops().notice(
                "denied access to %d for plugin %@(%{public}@): the plug-in is on hold", pid, identifier, uuid);
            fail(11, format("access to plugin %@ denied: %@", identifier, Value::string(kOnHoldReason)));
            return false;
        }
        if (plugIn->isData())
            return true;
        if (auto reason = plugIn->allowForClient(*m_client)) {
            OMLog::ops().notice("denied access to %d for plugin %@(%{public}@): %{public}@", pid, identifier, uuid,
                Value::string(*reason));
            fail(11, format("access to plugin %@ denied: %@", identifier, Value::string(*reason)));
            return false;
        }
        if (seen.insert(plugIn).second)
            toReady.push_back(plugIn);
        return true;
    });
    if (!completed)
        return;

    // A failure does not stop the rest: every plug-in that passed is enabled, and the first
    // failure is what the client hears.
    std::optional<OMError> firstFailure;
    for (const auto& plugIn : toReady) {
        auto failure = plugIn->enableForClient(*m_client);
        if (failure && !firstFailure)
            firstFailure = std::move(failure);
    }
    if (firstFailure)
        return fail(4, *firstFailure);
    done();
}

void Transaction::accessPlugIns()
{
    ArrayBuilder tokens;
    const bool completed = processUuidList([&](const std::shared_ptr<OMDPlugIn>& plugIn) {
        const std::string path = plugIn->path().value_or(std::string());
        auto token = Sandbox::issueFileExtension(Sandbox::kReadOnlyFileClass, path, Sandbox::kCanonicalPath);
        if (!token.ok()) {
            fail(4, format("cannot create extension to %@: %d", Value::string(path), token.error().code()));
            return false;
        }
        tokens.append(Value::string(std::move(token).releaseValue()));
        return true;
    });
    if (!completed)
        return;
    m_reply.set("extensions", tokens.build());
    done();
}

} // namespace om

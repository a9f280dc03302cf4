// "annotate" and "bulk-annotate": the user's elections and the values hosts keep about plug-ins.
// Each plug-in's change is on disk before the next one is made; success posts the change
// notification so that hosts run discovery again.
#include "Ombrel/OMLog.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDServer.h"
#include "omd/Transaction.h"

namespace om {

void Transaction::annotatePlugIns()
{
    auto annotations = conduit_dictionary_get_dictionary(m_request, "annotations");
    if (!annotations)
        return fail(4, "invalid request format (bad annotations dictionary)");
    DictionaryBuilder change;
    if (const Value& election = (*annotations)["election"]; !election.isNone()) {
        if (!election.isNumber())
            return fail(4, "invalid request format (annotation election)");
        change.set("election", election);
    }
    if (const Value& extension = (*annotations)["extension"]; !extension.isNone()) {
        if (!extension.isDictionary())
            return fail(4, "invalid request format (annotation extension)");
        change.set("extension", extension);
    }
    if (change.count() == 0)
        return done();

    const Value changed = change.build();
    const pid_t pid = m_client->pid();
    const bool completed = processUuidList([&](const std::shared_ptr<OMDPlugIn>& plugIn) {
        const Value uuid = Value::uuid(plugIn->registrationUuid());
        const Value identifier = Value::string(plugIn->identifier().value_or(std::string()));
        OMLog::ops().debug("client %d plug-in %@(%{public}@) annotation change: %@", pid, identifier, uuid, changed);
        if (changed.contains("election"))
            OMLog::ops().info(
                "client %d plug-in %@(%{public}@) election := %@", pid, identifier, uuid, changed["election"]);
        server()->setAnnotation(changed, *plugIn);
        return true;
    });
    if (!completed)
        return;
    server()->notifyAnnotationChange();
    done();
}

void Transaction::bulkAnnotatePlugIns()
{
    auto annotations = conduit_dictionary_get_dictionary(m_request, "annotations");
    if (!annotations)
        return fail(4, "invalid request format (bad annotations dictionary)");
    const pid_t pid = m_client->pid();
    OMLog::ops().debug("bulk change requested for %u plug-ins", static_cast<unsigned>(annotations->count()));
    for (const auto& [key, extension] : annotations->entries()) {
        if (!extension.isDictionary())
            return fail(18, "annotations values must be dictionaries");
        auto uuid = Uuid::parse(key);
        if (!uuid)
            return fail(18, "invalid plug-in UUID value");
        auto plugIn = server()->findPlugIn(*uuid);
        if (!plugIn)
            return fail(2, "no plug-in with the requested uuid");
        OMLog::ops().debug("client %d bulk plug-in %@(%{public}@) annotation change: %@", pid,
            Value::string(plugIn->identifier().value_or(std::string())), Value::uuid(*uuid), extension);
        server()->setAnnotation(Value::dictionary({ { "extension", extension } }), *plugIn);
    }
    server()->notifyAnnotationChange();
    done();
}

} // namespace om

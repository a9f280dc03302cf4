// Whether a running instance of a plug-in is busy, as the instances themselves told jobd.
#include "Ombrel/OMLog.h"
#include "omd/OMDPlugIn.h"
#include "platform/Assertions.h"
#include "platform/JobManager.h"

namespace om {

std::optional<Value> OMDPlugIn::checkBusy() const
{
    const Value identifier = infoKey("VBBundleIdentifier");
    const std::string* bundleIdentifier = identifier.asString();
    // jobd knows instances only by bundle identifier: without one, none can be running.
    if (!bundleIdentifier)
        return std::nullopt;

    auto instances = Assertions::busyInstances({ *bundleIdentifier });
    if (!instances.ok()) {
        // Nothing can be busy in a jobd that is not there; a hold must not depend on it.
        OMLog::ops().error(
            "unable to ask jobd whether %@ is busy: %s", identifier, instances.error().localizedDescription());
        return std::nullopt;
    }
    for (const Value& instance : instances.value()) {
        if (const std::string* busy = instance.stringFor(kJobManagerBundleIdentifierKey))
            return Value::dictionary({ { kJobManagerBundleIdentifierKey, *busy } });
        OMLog::ops().error(
            "grantd reported incomplete bundle for plug-in %@/%{public}@", identifier, registrationUuid().string());
    }
    return std::nullopt;
}

} // namespace om

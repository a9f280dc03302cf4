// Whether a host may use a plug-in: the host's allowed-plugins entitlement, then the entitlement
// the plug-in requires of its hosts.
#include "omd/OMDConduitClient.h"
#include "omd/OMDPlugIn.h"
#include "platform/Format.h"

namespace om {

namespace {

constexpr const char* kAllowedPlugInsEntitlement = "com.orvex.developer.ombrel.allowedplugins";

} // namespace

std::optional<std::string> OMDPlugIn::allowForClient(const OMDConduitClient& client) const
{
    const Value allowed = client.entitlementValueForKey(kAllowedPlugInsEntitlement);
    if (!allowed.isNone() && !allowed.isDictionary())
        return std::string("invalid host restriction entitlement");
    if (allowed.isDictionary() && !match(allowed))
        return std::string("the host's plug-in entitlement does not allow this plug-in");
    const Value required = pluginKey("QSExtensionHostEntitlement");
    if (required.isNone())
        return std::nullopt;
    const std::string* name = required.asString();
    // A name that is no text names no entitlement a host can hold.
    if (!name || !client.hasEntitlement(*name))
        return format("the host does not have the \"%@\" entitlement", required);
    return std::nullopt;
}

} // namespace om

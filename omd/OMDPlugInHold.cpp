#include "omd/OMDPlugInHold.h"

namespace om {

OMDPlugInHold::OMDPlugInHold(PlugInSet blocked, const std::shared_ptr<OMDConduitClient>& client)
    : m_uuid(Uuid::random())
    , m_blocked(std::move(blocked))
    , m_client(client)
    , m_clientIdentity(client.get())
{
}

std::shared_ptr<OMDPlugInHold> OMDPlugInHold::initWithPlugIns(
    const std::vector<std::shared_ptr<OMDPlugIn>>& plugIns, const std::shared_ptr<OMDConduitClient>& client)
{
    return std::shared_ptr<OMDPlugInHold>(new OMDPlugInHold(PlugInSet(plugIns.begin(), plugIns.end()), client));
}

bool OMDPlugInHold::heldBy(const OMDConduitClient& client) const
{
    return m_clientIdentity == &client;
}

} // namespace om

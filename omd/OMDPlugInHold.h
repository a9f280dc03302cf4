// One hold on a set of plug-ins: while it lives, they are left out of discovery and cannot be
// readied. It is named by a random token, refers to the client that asked for it weakly, and keeps
// the daemon from exiting for idleness for as long as it exists.
#pragma once

#include <memory>
#include <unordered_set>

#include "omd/OMDPlugIn.h"
#include "platform/Conduit.h"
#include "platform/Uuid.h"

namespace om {

class OMDConduitClient;

class OMDPlugInHold {
public:
    using PlugInSet = std::unordered_set<std::shared_ptr<OMDPlugIn>, OMPlugInCore::Hash, OMPlugInCore::Equal>;

    static std::shared_ptr<OMDPlugInHold> initWithPlugIns(
        const std::vector<std::shared_ptr<OMDPlugIn>>& plugIns, const std::shared_ptr<OMDConduitClient>& client);

    const Uuid& uuid() const { return m_uuid; }
    const PlugInSet& blocked() const { return m_blocked; }
    // The record that asked for the hold, compared by identity; it may be gone.
    bool heldBy(const OMDConduitClient& client) const;
    // Membership by plug-in record equality: the registration, whatever record object asks.
    bool blocks(const std::shared_ptr<OMDPlugIn>& plugIn) const { return m_blocked.contains(plugIn); }

    bool isEqual(const OMDPlugInHold& other) const { return m_uuid == other.m_uuid; }
    size_t hash() const { return std::hash<Uuid>()(m_uuid); }

private:
    OMDPlugInHold(PlugInSet blocked, const std::shared_ptr<OMDConduitClient>& client);

    const Uuid m_uuid;
    const PlugInSet m_blocked;
    const std::weak_ptr<OMDConduitClient> m_client;
    const OMDConduitClient* const m_clientIdentity; // compared only, never followed
    ConduitConnection::KeepAlive m_keepAlive;
};

} // namespace om

// "lock": holds a set of plug-ins out of discovery and readying until the token it answers with is
// released (or the client dies), optionally refusing when one is busy or stopping their instances
// first. A request carrying an array "uuids" releases instead.
#include <vector>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMDaemonClient.h"
#include "Ombrel/OMLog.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDPlugInHold.h"
#include "omd/OMDServer.h"
#include "omd/Transaction.h"

namespace om {

namespace {

using PlugIns = std::vector<std::shared_ptr<OMDPlugIn>>;

Value describePlugIns(const PlugIns& plugIns)
{
    ArrayBuilder described;
    for (const auto& plugIn : plugIns)
        described.append(Value::string(plugIn->rgproxy()->description()));
    return described.build();
}

} // namespace

void Transaction::lockDownPlugIns()
{
    if (auto tokens = conduit_dictionary_get_array(m_request, "uuids")) {
        for (const Value& element : tokens->elements()) {
            if (auto token = element.asUuid())
                server()->unholdToken(*token);
        }
        done();
        return;
    }

    const uint64_t flags = m_request["flags"].asUInt64().value_or(0);
    PlugIns plugIns;
    const bool named = marshalPaths([&](const std::string& path, bool resolved) {
        if (!resolved) {
            fail(9, format("invalid path: %@", path));
            return false;
        }
        if (flags & OMDaemonClient::OMLockFlagPlugInPaths) {
            auto plugIn = server()->findPlugInAtPath(OMBundle::fileURL(path));
            if (!plugIn) {
                fail(9, format("no plug-in at path:%@", path));
                return false;
            }
            plugIns.push_back(std::move(plugIn));
            return true;
        }
        if (auto contained = server()->plugInsWithinApplication(OMBundle::fileURL(path)))
            plugIns.insert(plugIns.end(), contained->begin(), contained->end());
        return true;
    });
    if (!named)
        return;
    OMLog::ops().info("processing hold request for plug-ins:%@", describePlugIns(plugIns));

    if (flags & OMDaemonClient::OMLockFlagCheckBusy) {
        PlugIns busy;
        ArrayBuilder conflicts;
        for (const auto& plugIn : plugIns) {
            if (auto description = plugIn->checkBusy()) {
                busy.push_back(plugIn);
                conflicts.append(*description);
            }
        }
        if (!busy.empty()) {
            OMLog::ops().debug("hold refused. Busy plug-ins:%@", describePlugIns(busy));
            m_reply.set("conflicts", conflicts.build());
            fail(14, "plug-ins are busy");
            return;
        }
    }

    auto hold = OMDPlugInHold::initWithPlugIns(plugIns, m_client);
    const Uuid token = hold->uuid();
    server()->addHold(std::move(hold));
    m_reply.set("uuids", Value::uuid(token));

    if (flags & OMDaemonClient::OMLockFlagTerminate) {
        RegistrarPlugInRecords records;
        records.reserve(plugIns.size());
        for (const auto& plugIn : plugIns)
            records.push_back(plugIn->rgproxy());
        server()->terminatePlugIns(records, [self = shared_from_this(), token] {
            OMLog::ops().info("forced termination complete; hold request granted uuid:%{public}@", token.string());
            self->done();
        });
        return;
    }
    OMLog::ops().info("hold request granted uuid:%{public}@", token.string());
    done();
}

} // namespace om

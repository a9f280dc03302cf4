// "add", "remove" and "bulk", and the walkers over a request's paths and plug-in UUIDs that other
// requests share. The first bad element ends a walk; what earlier elements did stays done.
#include "Ombrel/OMBundle.h"
#include "Ombrel/OMLog.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDServer.h"
#include "omd/Transaction.h"
#include "platform/Probes.h"
#include "platform/Storage.h"

namespace om {

namespace {

constexpr const char* kManagerEntitlement = "com.orvex.private.ombrel.manager";
// Canonical paths are resolved into a buffer of this many bytes.
constexpr size_t kPathBufferSize = 1024;

} // namespace

bool Transaction::marshalPaths(const PathHandler& handler)
{
    auto paths = conduit_dictionary_get_array(m_request, "paths");
    if (!paths) {
        fail(4, "invalid request format");
        return false;
    }
    for (const Value& element : paths->elements()) {
        const std::string* path = element.asString();
        if (!path) {
            fail(4, "invalid request format");
            return false;
        }
        if (!path->starts_with('/')) {
            fail(9, format("absolute path required: %s", *path));
            return false;
        }
        auto canonical = Storage::canonicalPath(*path, kPathBufferSize);
        const bool resolved = canonical.ok();
        if (!handler(resolved ? canonical.value() : *path, resolved))
            return false;
    }
    return true;
}

bool Transaction::processPaths(const PathHandler& handler)
{
    if (!marshalPaths(handler))
        return false;
    done();
    return true;
}

void Transaction::addPlugIns()
{
    processPaths([this](const std::string& path, bool resolved) {
        if (!resolved) {
            fail(9, format("invalid plugin path: %@", path));
            return false;
        }
        OM_PROBE1(plugin__add, path.c_str());
        if (server()->addPlugIn(OMBundle::fileURL(path))) {
            OMLog::ops().notice("failed to register plug-in at %@", path);
            fail(2, format("unable to register plug-in at %@", path));
            return false;
        }
        return true;
    });
}

void Transaction::removePlugIns()
{
    processPaths([this](const std::string& path, bool resolved) {
        OM_PROBE2(plugin__remove, path.c_str(), resolved);
        if (!m_client->hasEntitlement(kManagerEntitlement)) {
            Log::defaultLog().notice(
                "refused request from pid=%d to remove plug-in at %@ - client lacks required entitlement",
                m_client->pid(), path);
            fail(11, "caller lacks entitlement for this operation");
            return false;
        }
        // Unresolved paths go on as sent: a bundle already deleted from disk can still be removed.
        if (server()->removePlugIn(OMBundle::fileURL(path))) {
            fail(9, format("no plugin at %@", path));
            return false;
        }
        return true;
    });
}

void Transaction::bulkPlugIns()
{
    const uint64_t flags = m_request["flags"].asUInt64().value_or(0);
    OMLog::ops().info("bulk options 0x%lx not supported", flags);
    done();
}

bool Transaction::processUuidList(const PlugInHandler& handler)
{
    auto uuids = conduit_dictionary_get_array(m_request, "uuids");
    if (!uuids) {
        fail(4, "invalid request format (uuid)");
        return false;
    }
    for (const Value& element : uuids->elements()) {
        // A UUID value always holds its 16 bytes, so making one from them cannot fail here.
        auto uuid = element.asUuid();
        if (!uuid) {
            fail(4, "invalid request (bad uuid array)");
            return false;
        }
        auto plugIn = server()->findPlugIn(*uuid);
        if (!plugIn) {
            fail(4, "no such plugin (uuid not found)");
            return false;
        }
        if (!handler(plugIn))
            return false;
    }
    return true;
}

} // namespace om

// Told by the database that plug-ins are about to be uninstalled, once their cached records are
// gone. The server is the one delegate: it stops the plug-ins' running instances.
#pragma once

#include "platform/RegistrarPlugInRecord.h"

namespace om {

class OMDatabaseDelegate {
public:
    virtual ~OMDatabaseDelegate() = default;
    virtual void removedPlugIns(const RegistrarPlugInRecords& records) = 0;
};

} // namespace om

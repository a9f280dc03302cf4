// Process assertions, served by jobd: an instance tells jobd that it is busy (doing work that
// must not be cut short) or idle again; omd asks which instances of some bundle identifiers are
// busy before it holds their plug-ins.
//
// An instance declares over its own connection to jobd, which identifies it by the pidfd of the
// peer, never by anything the peer says. A busy declaration lasts until the instance declares
// itself idle, closes the Assertions object, or exits.
#pragma once

#include <sys/types.h>

#include <memory>
#include <set>
#include <string>
#include <vector>

#include "platform/Conduit.h"
#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class Assertions {
public:
    // The connection of this process (an instance) to jobd. Declarations travel on it.
    static std::shared_ptr<Assertions> create();
    ~Assertions();

    // Synchronous; the error's code is a JobManagerStatus (kJobManagerNothingOnRecord when this
    // process is no instance that jobd launched).
    Result<void> declareBusy();
    Result<void> declareIdle();

    // The busy instances of the given bundle identifiers: one dictionary per instance holding
    // kJobManagerBundleIdentifierKey (text) and "pid" (integer). Needs kJobManagerEntitlement.
    static Result<std::vector<Value>> busyInstances(const std::set<std::string>& bundleIdentifiers);

private:
    explicit Assertions(std::shared_ptr<ConduitConnection> connection);
    Result<void> declare(bool busy);
    std::shared_ptr<ConduitConnection> m_connection;
};

} // namespace om

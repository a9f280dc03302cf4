// The facts about a host that omd's access rules read, gathered by omctl the way omd gathers them
// from a connecting client: the entitlements in its executable (when the file's owner and mode let
// them count) and the plug-ins directory of its application bundle.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class OmctlHost {
public:
    // A host that holds no entitlement and has no bundle, as omctl itself is.
    OmctlHost() = default;
    static Result<OmctlHost> forExecutable(const std::string& path);
    static Result<OmctlHost> forProcess(pid_t pid);

    // "omctl's own view ..." or the executable (and process) described.
    const std::string& description() const { return m_description; }
    const std::optional<std::string>& executable() const { return m_executable; }
    // A dictionary, or none when the host has none (or they do not count).
    const Value& entitlements() const { return m_entitlements; }
    // Why entitlements found in the executable do not count; empty when they do or there are none.
    const std::string& untrustedReason() const { return m_untrustedReason; }
    const std::optional<std::string>& plugInsPath() const { return m_plugInsPath; }

    Value entitlementValueForKey(std::string_view key) const { return m_entitlements[key]; }
    // Present and not false (0 counts as false).
    bool hasEntitlement(std::string_view key) const;

private:
    void setBundleOf(const std::string& executable);

    std::string m_description = "a host without entitlements or application bundle (omctl itself)";
    std::optional<std::string> m_executable;
    Value m_entitlements;
    std::string m_untrustedReason;
    std::optional<std::string> m_plugInsPath;
};

} // namespace om

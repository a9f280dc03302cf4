// OMSandboxExtension: the receiving side's holder of one sandbox-extension token and of the handle
// that consuming it gives. Access granted through a holder ends with it.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace om {

class OMSandboxExtension {
public:
    // A holder with handle 0 (not consumed).
    static std::shared_ptr<OMSandboxExtension> initWithExtension(std::string token);
    ~OMSandboxExtension();
    OMSandboxExtension(const OMSandboxExtension&) = delete;
    OMSandboxExtension& operator=(const OMSandboxExtension&) = delete;

    const std::string& token() const { return m_token; }
    // 0 when not consumed; otherwise what the platform answered, -1 for a token it refused.
    int64_t handle() const { return m_handle.load(); }

    // Consumes the token once per holder; later calls do nothing until expel.
    void consume();
    // Releases the handle, if any, and returns to handle 0.
    void expel();

    // Tokens for the resources a plug-in shares: resources is a name or an array of names
    // relative to the bundle at bundlePath ("." for the bundle itself); other elements are
    // skipped. The result maps each name to its token. A resource that cannot be granted —
    // missing, or resolving to a place outside the bundle — is left out and logged.
    static Value issueForResources(const std::string& bundlePath, const Value& resources);

private:
    explicit OMSandboxExtension(std::string token)
        : m_token(std::move(token))
    {
    }

    const std::string m_token;
    std::atomic<int64_t> m_handle { 0 };
};

} // namespace om

// OMDPlugInSignature: a plug-in's code-signing facts as the daemon reports them. Nothing here
// reads a signature yet; the values are placeholders that differ for every object, so that nothing
// downstream can come to depend on two plug-ins sharing a hash.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/OMError.h"

namespace om {

class OMDPlugInSignature {
public:
    // The bundle at url is not read and error is never filled.
    static std::shared_ptr<OMDPlugInSignature> initWithURL(
        std::string_view url, std::optional<OMError>* error = nullptr);

    // Code-directory hash, 20 bytes.
    const std::vector<uint8_t>& cdhash() const { return m_cdhash; }
    const std::string& requirement() const { return m_requirement; }

private:
    OMDPlugInSignature(std::vector<uint8_t> cdhash, std::string requirement)
        : m_cdhash(std::move(cdhash))
        , m_requirement(std::move(requirement))
    {
    }

    const std::vector<uint8_t> m_cdhash;
    const std::string m_requirement;
};

} // namespace om

// A plug-in record built from the Registrar's record, as omd builds its own: the key lookups and
// the info dictionary come from the Registrar (SDK merged, canonical), so that matching rules
// against it answers as omd's matcher does. omctl's "why" reasons with it.
#pragma once

#include <memory>

#include "Ombrel/OMPlugInCore.h"
#include "platform/RegistrarPlugInRecord.h"

namespace om {

class OmctlRegistrarPlugIn : public OMPlugInCore {
public:
    // Null when the record has no bundle path or setup refuses it. annotations: what omd stores
    // for the plug-in, or none.
    static std::shared_ptr<OmctlRegistrarPlugIn> create(
        std::shared_ptr<const RegistrarPlugInRecord> record, const Value& annotations);

    const RegistrarPlugInRecord& record() const { return *m_record; }

    Value infoKey(std::string_view key) const override;
    Value pluginKey(std::string_view key) const override;
    Value attribute(std::string_view key) const override;
    Value bundleInfoDictionary() const override;
    // The core checks, then omd's own: a data container for a plug-in that runs code, and a
    // containing application for a plug-in outside the system.
    std::optional<OMError> diagnose() const override;

private:
    explicit OmctlRegistrarPlugIn(std::shared_ptr<const RegistrarPlugInRecord> record)
        : m_record(std::move(record))
    {
    }

    const std::shared_ptr<const RegistrarPlugInRecord> m_record;
};

} // namespace om

#include "tools/omctl/OmctlRegistrarPlugIn.h"

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMMakeError.h"

namespace om {

std::shared_ptr<OmctlRegistrarPlugIn> OmctlRegistrarPlugIn::create(
    std::shared_ptr<const RegistrarPlugInRecord> record, const Value& annotations)
{
    if (!record || !record->bundlePath())
        return nullptr;
    std::shared_ptr<OmctlRegistrarPlugIn> plugIn(new OmctlRegistrarPlugIn(record));
    if (!plugIn->constructWithName(record->identifier(), OMBundle::fileURL(*record->bundlePath()), Value(),
            record->plugInDictionary(), record->uuid()))
        return nullptr;
    plugIn->setEntitlements(record->entitlements());
    plugIn->setOriginalIdentifier(record->originalIdentifier());
    plugIn->setOnSystemVolume(record->onSystemPartition());
    if (const auto& app = record->containingApp())
        plugIn->setContainingUrl(OMBundle::fileURL(app->path()));
    plugIn->setAnnotations(annotations);
    return plugIn;
}

Value OmctlRegistrarPlugIn::infoKey(std::string_view key) const
{
    return m_record->lookup(key, RegistrarScope::Info);
}

Value OmctlRegistrarPlugIn::pluginKey(std::string_view key) const
{
    return m_record->lookup(key, RegistrarScope::PlugIn);
}

Value OmctlRegistrarPlugIn::attribute(std::string_view key) const
{
    return m_record->lookup(key, RegistrarScope::Attributes);
}

Value OmctlRegistrarPlugIn::bundleInfoDictionary() const
{
    return m_record->infoDictionary();
}

std::optional<OMError> OmctlRegistrarPlugIn::diagnose() const
{
    if (auto problem = OMPlugInCore::diagnose())
        return problem;
    if (!isData() && !m_record->dataContainerPath())
        return OMMakeError(kMisconfiguredErrorCode, "this plug-in has no sandbox data container");
    if (!containingUrl() && !path().value_or(std::string()).starts_with("/System/"))
        return OMMakeError(kMisconfiguredErrorCode, "plug-ins outside containing apps must be in /System");
    return std::nullopt;
}

} // namespace om

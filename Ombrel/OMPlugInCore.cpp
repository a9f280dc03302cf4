#include "Ombrel/OMPlugInCore.h"

#include <cctype>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMLog.h"
#include "Ombrel/OMMakeError.h"
#include "platform/Fatal.h"

namespace om {

namespace {

constexpr std::string_view kAppExtensionSuffix = ".appex";
// The protocol and principal class an app extension has when it declares none.
constexpr std::string_view kDefaultAppExtensionSpec = "QSObject";
constexpr std::string_view kDataProtocolSpec = "#Data";

// Log lines name a bundle by its path; a URL that has none is shown as it is.
Value pathForLog(const std::string& url)
{
    return Value(OMBundle::pathOfFileURL(url).value_or(url));
}

} // namespace

std::shared_ptr<OMPlugInCore> OMPlugInCore::initWithName(const std::optional<std::string>& name,
    const std::optional<std::string>& url, const Value& bundleInfo, const Value& info, const std::optional<Uuid>& uuid)
{
    std::shared_ptr<OMPlugInCore> record(new OMPlugInCore());
    if (!record->constructWithName(name, url, bundleInfo, info, uuid))
        return nullptr;
    return record;
}

bool OMPlugInCore::constructWithName(const std::optional<std::string>& name, const std::optional<std::string>& url,
    const Value& bundleInfo, const Value& info, const std::optional<Uuid>& uuid)
{
    if (!setupWithName(name, url, bundleInfo, info, uuid))
        return false;
    // A record made without an info dictionary (the daemon's) is handed its plug-in dictionary.
    if (plugInDictionary().isNone())
        setPlugInDictionary(info);
    return true;
}

bool OMPlugInCore::setupWithName(const std::optional<std::string>& name, const std::optional<std::string>& url,
    const Value& bundleInfo, const Value&, const std::optional<Uuid>& uuid)
{
    if (!url)
        return false;
    if (!name) {
        OMLog::ops().error("missing identifier in plug-in at %@", pathForLog(*url));
        return false;
    }
    if (!bundleInfo.isNone() && !setDictionaries(normalizeInfoDictionary(bundleInfo))) {
        OMLog::ops().notice(
            "malformed plug-in dictionary in plug-in %@ at %@: %@", Value(*name), Value(*url), bundleInfo);
        return false;
    }
    setIdentifier(name);
    setUrl(url);
    setUuid(uuid ? *uuid : Uuid::random());
    return true;
}

bool OMPlugInCore::setDictionaries(const Value& info)
{
    if (!info.isDictionary())
        return false;
    setBundleInfoDictionary(info);
    const Value& plugIn = info["QSExtension"];
    if (!plugIn.isDictionary())
        return false;
    setPlugInDictionary(plugIn);
    if (plugIn.contains("Multiple"))
        OMLog::ops().notice("multiplexed plug-ins (%{public}@ key) obsolete and ignored", Value("Multiple"));
    return true;
}

Value OMPlugInCore::normalizeInfoDictionary(const Value& info) const
{
    return info;
}

void OMPlugInCore::canonicalize()
{
    DictionaryBuilder attributesCopy(attributes());
    DictionaryBuilder plugInCopy(plugInDictionary());
    Value canonicalAttributes = attributesCopy.build();
    plugInCopy.set("QSExtensionAttributes", canonicalAttributes);
    setPlugInDictionary(plugInCopy.build());
    // Asked through attribute() after the store, so that a subclass's view of the attributes decides.
    if (!attribute("QSExtensionVersion").isNone())
        return;
    Value version = infoKey("VBBundleShortVersionString");
    DictionaryBuilder versioned(canonicalAttributes);
    versioned.set("QSExtensionVersion", version.isNone() ? Value("1") : version);
    DictionaryBuilder withVersion(plugInDictionary());
    withVersion.set("QSExtensionAttributes", versioned.build());
    setPlugInDictionary(withVersion.build());
}

Value OMPlugInCore::infoKey(std::string_view key) const
{
    return bundleInfoDictionary()[key];
}

Value OMPlugInCore::pluginKey(std::string_view key) const
{
    return plugInDictionary()[key];
}

Value OMPlugInCore::attribute(std::string_view key) const
{
    return attributes()[key];
}

// clang-format off
std::optional<std::string> OMPlugInCore::identifier() const { return read(m_identifier); }
void OMPlugInCore::setIdentifier(std::optional<std::string> identifier) { write(m_identifier, std::move(identifier)); }
std::optional<std::string> OMPlugInCore::originalIdentifier() const { return read(m_originalIdentifier); }
void OMPlugInCore::setOriginalIdentifier(std::optional<std::string> originalIdentifier) { write(m_originalIdentifier, std::move(originalIdentifier)); }
std::optional<std::string> OMPlugInCore::url() const { return read(m_url); }
void OMPlugInCore::setUrl(std::optional<std::string> url) { write(m_url, std::move(url)); }
Value OMPlugInCore::bundleInfoDictionary() const { return read(m_bundleInfoDictionary); }
void OMPlugInCore::setBundleInfoDictionary(Value bundleInfoDictionary) { write(m_bundleInfoDictionary, std::move(bundleInfoDictionary)); }
Value OMPlugInCore::plugInDictionary() const { return read(m_plugInDictionary); }
void OMPlugInCore::setPlugInDictionary(Value plugInDictionary) { write(m_plugInDictionary, std::move(plugInDictionary)); }
Value OMPlugInCore::entitlements() const { return read(m_entitlements); }
void OMPlugInCore::setEntitlements(Value entitlements) { write(m_entitlements, std::move(entitlements)); }
Value OMPlugInCore::annotations() const { return read(m_annotations); }
void OMPlugInCore::setAnnotations(Value annotations) { write(m_annotations, std::move(annotations)); }
std::optional<std::string> OMPlugInCore::containingUrl() const { return read(m_containingUrl); }
void OMPlugInCore::setContainingUrl(std::optional<std::string> containingUrl) { write(m_containingUrl, std::move(containingUrl)); }
bool OMPlugInCore::onSystemVolume() const { return read(m_onSystemVolume); }
void OMPlugInCore::setOnSystemVolume(bool onSystemVolume) { write(m_onSystemVolume, onSystemVolume); }
uint32_t OMPlugInCore::hubProtocolVersion() const { return read(m_hubProtocolVersion); }
void OMPlugInCore::setHubProtocolVersion(uint32_t hubProtocolVersion) { write(m_hubProtocolVersion, hubProtocolVersion); }
std::optional<std::string> OMPlugInCore::localizedName() const { return read(m_localizedName); }
void OMPlugInCore::setLocalizedName(std::optional<std::string> localizedName) { write(m_localizedName, std::move(localizedName)); }
std::optional<std::string> OMPlugInCore::localizedShortName() const { return read(m_localizedShortName); }
void OMPlugInCore::setLocalizedShortName(std::optional<std::string> localizedShortName) { write(m_localizedShortName, std::move(localizedShortName)); }
std::optional<std::string> OMPlugInCore::localizedContainingName() const { return read(m_localizedContainingName); }
void OMPlugInCore::setLocalizedContainingName(std::optional<std::string> localizedContainingName) { write(m_localizedContainingName, std::move(localizedContainingName)); }
int32_t OMPlugInCore::lastModified() const { return read(m_lastModified); }
void OMPlugInCore::setLastModified(int32_t lastModified) { write(m_lastModified, lastModified); }
std::optional<Uuid> OMPlugInCore::uuid() const { return read(m_uuid); }
void OMPlugInCore::setUuid(std::optional<Uuid> uuid) { write(m_uuid, uuid); }
std::optional<std::vector<uint8_t>> OMPlugInCore::cdhash() const { return read(m_cdhash); }
void OMPlugInCore::setCdhash(std::optional<std::vector<uint8_t>> cdhash) { write(m_cdhash, std::move(cdhash)); }
std::optional<std::string> OMPlugInCore::requirement() const { return read(m_requirement); }
void OMPlugInCore::setRequirement(std::optional<std::string> requirement) { write(m_requirement, std::move(requirement)); }
// clang-format on

bool OMPlugInCore::oldStyle() const
{
    if (!infoKey("QSExtension").isNone())
        return false;
    if (!infoKey("Ombrel").isNone())
        return true;
    internalInconsistency("unknown plug-in configuration style");
}

std::optional<std::string> OMPlugInCore::path() const
{
    auto location = url();
    if (!location)
        return std::nullopt;
    return OMBundle::pathOfFileURL(*location);
}

std::optional<std::string> OMPlugInCore::containingPath() const
{
    auto location = containingUrl();
    if (!location)
        return std::nullopt;
    return OMBundle::pathOfFileURL(*location);
}

Value OMPlugInCore::attributes() const
{
    return pluginKey("QSExtensionAttributes");
}

Value OMPlugInCore::version() const
{
    return attribute("QSExtensionVersion");
}

Value OMPlugInCore::protocolSpec() const
{
    Value value = pluginKey("QSExtensionProtocol");
    if (value.isNone() && isAppExtension())
        return Value(kDefaultAppExtensionSpec);
    return value;
}

Value OMPlugInCore::principalSpec() const
{
    Value value = pluginKey("PrincipalClass");
    if (value.isNone() && isAppExtension())
        return Value(kDefaultAppExtensionSpec);
    return value;
}

Value OMPlugInCore::sdkSpec() const
{
    return pluginKey("QSExtensionPointIdentifier");
}

Value OMPlugInCore::embeddedProtocolSpec() const
{
    Value value = pluginKey("EmbeddedProtocol");
    return value.isNone() ? protocolSpec() : value;
}

std::optional<std::string> OMPlugInCore::embeddedCodePath() const
{
    return std::nullopt;
}

std::chrono::sys_seconds OMPlugInCore::timestamp() const
{
    return std::chrono::sys_seconds(std::chrono::seconds(lastModified()));
}

bool OMPlugInCore::isAppExtension() const
{
    auto location = path();
    return location && location->ends_with(kAppExtensionSuffix);
}

bool OMPlugInCore::isMultiplexed() const
{
    return false;
}

bool OMPlugInCore::isHybrid() const
{
    return !pluginKey("EmbeddedCode").isNone();
}

bool OMPlugInCore::isDedicated() const
{
    return boolValue(pluginKey("Dedicated"));
}

bool OMPlugInCore::isData() const
{
    return protocolSpec() == Value(kDataProtocolSpec);
}

std::optional<OMError> OMPlugInCore::diagnose() const
{
    if (!identifier())
        return OMMakeError(
            kMisconfiguredErrorCode, "missing identifier (no QSExtensionIdentifier, nor even VBBundleIdentifier)");
    if (protocolSpec().isNone())
        return OMMakeErrorWithFormat(
            kMisconfiguredErrorCode, "missing \"%@\" key in Info.vlist or SDK", Value("QSExtensionProtocol"));
    if (attributes().isNone())
        return OMMakeErrorWithFormat(
            kMisconfiguredErrorCode, "missing \"%@\" key in Info.vlist or SDK", Value("QSExtensionAttributes"));
    if (isAppExtension() && principalSpec() != Value(kDefaultAppExtensionSpec))
        return OMMakeErrorWithFormat(
            kMisconfiguredErrorCode, "Application Extensions may not use the \"%@\" key", Value("PrincipalClass"));
    if (!pluginKey("PassProxy").isNone())
        return OMMakeErrorWithFormat(
            kMisconfiguredErrorCode, "the \"%@\" key is not supported on this platform", Value("PassProxy"));
    if (isHybrid())
        return OMMakeError(kMisconfiguredErrorCode, "hybrid plug-ins are not supported on this platform");
    return std::nullopt;
}

void OMPlugInCore::augmentInterface(const Value&)
{
}

bool OMPlugInCore::isEqual(const OMPlugInCore& other) const
{
    if (this == &other)
        return true;
    auto mine = uuid();
    auto theirs = other.uuid();
    if (!mine || !theirs)
        internalInconsistency("plug-in record compared before setup gave it a uuid");
    return *mine == *theirs;
}

size_t OMPlugInCore::hash() const
{
    auto mine = uuid();
    if (!mine)
        internalInconsistency("plug-in record hashed before setup gave it a uuid");
    return std::hash<Uuid>()(*mine);
}

bool OMPlugInCore::boolValue(const Value& value)
{
    if (value.isNumber())
        return !value.numericallyEquals(0);
    const std::string* text = value.asString();
    if (!text)
        return false;
    size_t at = 0;
    while (at < text->size() && std::isspace(static_cast<unsigned char>((*text)[at])))
        ++at;
    if (at < text->size() && ((*text)[at] == '+' || (*text)[at] == '-'))
        ++at;
    while (at < text->size() && (*text)[at] == '0')
        ++at;
    if (at == text->size())
        return false;
    const char first = (*text)[at];
    return first == 'Y' || first == 'y' || first == 'T' || first == 't' || (first >= '1' && first <= '9');
}

} // namespace om

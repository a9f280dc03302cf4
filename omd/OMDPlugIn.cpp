#include "omd/OMDPlugIn.h"

#include <cmath>
#include <functional>
#include <limits>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMLog.h"
#include "Ombrel/OMMakeError.h"
#include "Ombrel/OMMatcher.h"
#include "Ombrel/OMSandboxExtension.h"
#include "omd/OMDServer.h"

namespace om {

namespace {

constexpr const char* kReplacePluginEntitlement = "com.orvex.developer.replace-plugin";

// Seconds since 1970, truncated toward zero and kept within 32 bits.
int32_t wholeSeconds(const std::optional<double>& date)
{
    if (!date || std::isnan(*date))
        return 0;
    const double truncated = std::trunc(*date);
    if (truncated <= double(std::numeric_limits<int32_t>::min()))
        return std::numeric_limits<int32_t>::min();
    if (truncated >= double(std::numeric_limits<int32_t>::max()))
        return std::numeric_limits<int32_t>::max();
    return static_cast<int32_t>(truncated);
}

uint32_t hubProtocolVersionOf(const Value& declared, bool oldStyle)
{
    if (declared.isNone())
        return oldStyle ? 1 : 2;
    if (auto version = declared.asUInt64())
        return static_cast<uint32_t>(*version);
    if (auto version = declared.asInt64())
        return static_cast<uint32_t>(*version);
    if (auto version = declared.asDouble())
        return static_cast<uint32_t>(static_cast<int64_t>(*version));
    return 0;
}

// A display name read once from the Registrar and kept; asked again while the Registrar has none.
std::optional<std::string> lazily(
    std::mutex& mutex, std::optional<std::string>& field, const std::function<std::optional<std::string>()>& fill)
{
    {
        std::lock_guard lock(mutex);
        if (field)
            return field;
    }
    auto answer = fill();
    std::lock_guard lock(mutex);
    if (!field)
        field = answer;
    return field;
}

} // namespace

std::shared_ptr<OMDPlugIn> OMDPlugIn::initWithRGData(std::shared_ptr<const RegistrarPlugInRecord> record)
{
    if (!record || !record->bundlePath())
        return nullptr;
    std::shared_ptr<OMDPlugIn> plugIn(new OMDPlugIn(record));
    if (!plugIn->constructWithName(record->identifier(), OMBundle::fileURL(*record->bundlePath()), Value(),
            record->plugInDictionary(), record->uuid()))
        return nullptr;
    plugIn->setEntitlements(record->entitlements());
    plugIn->setOriginalIdentifier(record->originalIdentifier());
    plugIn->setLastModified(wholeSeconds(record->registrationDate()));
    plugIn->setOnSystemVolume(record->onSystemPartition());
    plugIn->setHubProtocolVersion(
        hubProtocolVersionOf(plugIn->plugInDictionary()["HubProtocolVersion"], !plugIn->infoKey("Ombrel").isNone()));
    if (const auto& app = record->containingApp())
        plugIn->setContainingUrl(OMBundle::fileURL(app->path()));
    if (auto problem = plugIn->diagnose()) {
        OMLog::ops().info("ignoring mis-configured plug-in at %@: %{public}@", *record->bundlePath(),
            problem->description().value_or(""));
        return nullptr;
    }
    return plugIn;
}

Value OMDPlugIn::infoKey(std::string_view key) const
{
    return m_rgproxy->lookup(key, RegistrarScope::Info);
}

Value OMDPlugIn::pluginKey(std::string_view key) const
{
    return m_rgproxy->lookup(key, RegistrarScope::PlugIn);
}

Value OMDPlugIn::attribute(std::string_view key) const
{
    return m_rgproxy->lookup(key, RegistrarScope::Attributes);
}

Value OMDPlugIn::bundleInfoDictionary() const
{
    return m_rgproxy->infoDictionary();
}

std::optional<std::string> OMDPlugIn::localizedName() const
{
    return lazily(m_namesMutex, m_localizedName, [this] { return m_rgproxy->displayName(); });
}

void OMDPlugIn::setLocalizedName(std::optional<std::string> name)
{
    std::lock_guard lock(m_namesMutex);
    m_localizedName = std::move(name);
}

std::optional<std::string> OMDPlugIn::localizedShortName() const
{
    return lazily(m_namesMutex, m_localizedShortName, [this] { return m_rgproxy->shortDisplayName(); });
}

void OMDPlugIn::setLocalizedShortName(std::optional<std::string> name)
{
    std::lock_guard lock(m_namesMutex);
    m_localizedShortName = std::move(name);
}

std::optional<std::string> OMDPlugIn::localizedContainingName() const
{
    return lazily(m_namesMutex, m_localizedContainingName, [this]() -> std::optional<std::string> {
        const auto& app = m_rgproxy->containingApp();
        return app ? app->displayName() : std::nullopt;
    });
}

void OMDPlugIn::setLocalizedContainingName(std::optional<std::string> name)
{
    std::lock_guard lock(m_namesMutex);
    m_localizedContainingName = std::move(name);
}

Value OMDPlugIn::valueForEntitlement(std::string_view key) const
{
    return entitlements()[key];
}

bool OMDPlugIn::hasEntitlement(std::string_view key) const
{
    const Value value = valueForEntitlement(key);
    return !value.isNone() && value != Value::boolean(false);
}

std::string OMDPlugIn::annotationKey() const
{
    if (const std::string* replaced = valueForEntitlement(kReplacePluginEntitlement).asString())
        return *replaced;
    return identifier().value_or(std::string());
}

std::optional<OMError> OMDPlugIn::diagnose() const
{
    if (auto problem = OMPlugInCore::diagnose())
        return problem;
    if (!isData() && !m_rgproxy->dataContainerPath())
        return OMMakeError(kMisconfiguredErrorCode, "this plug-in has no sandbox data container");
    if (!containingUrl() && !path().value_or(std::string()).starts_with("/System/"))
        return OMMakeError(kMisconfiguredErrorCode, "plug-ins outside containing apps must be in /System");
    return std::nullopt;
}

Value OMDPlugIn::prunedInfoDictionaryFor(const Value& info)
{
    std::vector<Value::Entry> kept;
    for (const auto& entry : info.entries()) {
        if (!entry.first.starts_with("DT"))
            kept.push_back(entry);
    }
    return Value::dictionary(std::move(kept));
}

namespace {

// Elections come from the server's annotation store; a process without a server has none.
const OMMatcher& matcher()
{
    static const OMMatcher shared([](const OMPlugInCore& plugIn) {
        auto server = OMDServer::server();
        return server ? server->annotationForPlugIn(static_cast<const OMDPlugIn&>(plugIn)) : Value();
    });
    return shared;
}

} // namespace

bool OMDPlugIn::match(const Value& rules) const
{
    return matcher().match(*this, rules);
}

bool OMDPlugIn::matchKey(std::string_view key, const Value& pattern) const
{
    return matcher().matchKey(*this, key, pattern);
}

bool OMDPlugIn::matchValuePatterns(const std::string& value, const Value& patterns)
{
    return OMMatcher::matchValuePatterns(value, patterns);
}

bool OMDPlugIn::matchValuePattern(const std::string& value, std::string_view pattern)
{
    return OMMatcher::matchValuePattern(value, pattern);
}

bool OMDPlugIn::matchDictionaryPattern(const Value& value, const Value& pattern)
{
    return OMMatcher::matchDictionaryPattern(value, pattern);
}

void OMDPlugIn::augmentForm(DictionaryBuilder& form) const
{
    Value shared = isAppExtension() ? Value::array({ Value(".") }) : pluginKey("Shared");
    if (shared.isNone())
        return;
    form.set("extensions", issueResourceExtensions(shared));
}

Value OMDPlugIn::issueResourceExtensions(const Value& resources) const
{
    return OMSandboxExtension::issueForResources(path().value_or(std::string()), resources);
}

} // namespace om

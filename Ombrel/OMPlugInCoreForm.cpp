// OMPlugInCore: the wire form, the dictionary in which a plug-in travels between the daemon and its
// clients, and the annotations a client refreshes from it.
#include "Ombrel/OMBundle.h"
#include "Ombrel/OMPlugInCore.h"

namespace om {

namespace {

std::optional<std::string> stringIn(const Value& form, std::string_view key)
{
    if (const std::string* text = form.stringFor(key))
        return *text;
    return std::nullopt;
}

void setIfPresent(DictionaryBuilder& form, std::string key, const std::optional<std::string>& text)
{
    if (text)
        form.set(std::move(key), Value(*text));
}

} // namespace

Value OMPlugInCore::exportForm(std::optional<OMError>*) const
{
    const Value info = bundleInfoDictionary();
    const auto location = path();
    const auto name = identifier();
    const auto original = originalIdentifier();
    const Value pluginVersion = version();
    const Value plugIn = plugInDictionary();
    const auto registration = uuid();
    if (!location || !name || !original || pluginVersion.isNone() || info.isNone() || plugIn.isNone() || !registration)
        return {};
    // The file the Registrar read the dictionary from is nobody else's business.
    DictionaryBuilder bundleInfo(info);
    bundleInfo.remove("VBBundleInfoVlistURL");
    const Value annotated = annotations();

    DictionaryBuilder form;
    form.set("hubProtocolVersion", Value::unsignedInteger(hubProtocolVersion()));
    form.set("path", *location);
    form.set("systemResident", Value::boolean(onSystemVolume()));
    form.set("identifier", *name);
    form.set("original-identifier", *original);
    form.set("version", pluginVersion);
    form.set("bundleInfo", bundleInfo.build());
    form.set("info", plugIn);
    form.set("uuid", registration->string());
    form.set("lastmodified", Value::integer(lastModified()));
    form.set("annotations", annotated.isNone() ? Value::dictionary({}) : annotated);

    form.set("entitlements", entitlements());
    setIfPresent(form, "containingPath", containingPath());
    setIfPresent(form, "localizedContainingDisplayName", localizedContainingName());
    setIfPresent(form, "localizedDisplayName", localizedName());
    setIfPresent(form, "localizedShortName", localizedShortName());
    return form.build();
}

std::shared_ptr<OMPlugInCore> OMPlugInCore::initWithForm(const Value& form)
{
    std::shared_ptr<OMPlugInCore> record(new OMPlugInCore());
    if (!record->setupWithForm(form))
        return nullptr;
    return record;
}

bool OMPlugInCore::setupWithForm(const Value& form)
{
    const auto location = stringIn(form, "path");
    if (!location)
        return false;
    std::optional<Uuid> registration = form["uuid"].asUuid();
    if (const std::string* text = form.stringFor("uuid"))
        registration = Uuid::parse(*text);
    // The plug-in dictionary comes from "bundleInfo"; "info" is handed on and not read.
    if (!setupWithName(
            stringIn(form, "identifier"), OMBundle::fileURL(*location), form["bundleInfo"], form["info"], registration))
        return false;

    const Value& hub = form["hubProtocolVersion"];
    setHubProtocolVersion(hub.isNone() ? 1 : static_cast<uint32_t>(hub.asUInt64().value_or(1)));
    setOriginalIdentifier(stringIn(form, "original-identifier"));
    if (const std::vector<uint8_t>* hash = form["hash"].asData())
        setCdhash(*hash);
    setRequirement(stringIn(form, "requirement"));
    setLastModified(static_cast<int32_t>(form["lastmodified"].asInt64().value_or(0)));
    setEntitlements(form["entitlements"]);
    if (auto containing = stringIn(form, "containingPath"))
        setContainingUrl(OMBundle::fileURL(*containing));
    setOnSystemVolume(boolValue(form["systemResident"]));
    setAnnotations(form["annotations"]);
    setLocalizedName(stringIn(form, "localizedDisplayName"));
    setLocalizedShortName(stringIn(form, "localizedShortName"));
    setLocalizedContainingName(stringIn(form, "localizedContainingDisplayName"));
    return true;
}

void OMPlugInCore::updateFromForm(const Value& form)
{
    setAnnotations(form["annotations"]);
}

void OMPlugInCore::setAnnotation(std::string_view key, const Value& value)
{
    // Replaced whole, never changed in place: a reader holding the old dictionary keeps it intact.
    std::lock_guard lock(m_mutex);
    DictionaryBuilder changed(m_annotations);
    changed.set(std::string(key), value);
    m_annotations = changed.build();
}

} // namespace om

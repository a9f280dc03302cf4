// Readying a plug-in for one host: the activation overlay handed to the job manager (the declared
// service with the daemon's environment and sandbox profile over it) and the consent that decides
// a keyboard's profile. Nothing is remembered here: enabling the same pair again repeats the call.
#include <cstdlib>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMLog.h"
#include "Ombrel/OMMakeError.h"
#include "omd/OMDConduitClient.h"
#include "omd/OMDPlugIn.h"
#include "platform/Consent.h"
#include "platform/JobManager.h"
#include "platform/ValueTreeConversion.h"

namespace om {

namespace {

constexpr const char* kKeyboardExtensionPoint = "com.orvex.keyboard-service";

// Profiles chosen by the extension point named in the plug-in dictionary.
struct ProfileRule {
    const char* extensionPoint;
    const char* profile;
};
constexpr ProfileRule kDictionaryProfiles[] = {
    { "com.orvex.glance.extension.preview", "glanced" },
    { "com.orvex.app.non-ui-extension", "sandpit-devtools" },
    { "com.orvex.app.non-ui-extension.multiple-instances", "sandpit-devtools" },
};

std::string appendComponent(const std::string& path, std::string_view component)
{
    if (!path.empty() && path.back() == '/')
        return path + std::string(component);
    return path + "/" + std::string(component);
}

} // namespace

std::set<std::string> OMDPlugIn::allowedConsentServices() const
{
    std::set<std::string> services;
    const auto containing = containingUrl();
    if (!containing)
        return services;
    auto bundle = OMBundle::initWithURL(*containing);
    // The consent store names applications by bundle identifier.
    auto identifier = bundle->bundleIdentifier();
    if (!identifier) {
        OMLog::ops().info("failed to create bundle for %@", Value::string(path().value_or(std::string())));
        return services;
    }
    // Nothing is cached between queries: each one reads the store anew.
    auto entries = Consent::informationForBundle(Consent::defaultPath(), *identifier);
    if (!entries.ok()) {
        OMLog::ops().info(
            "ConsentAccessCopyInformationForBundle failed for %@", Value::string(bundle->path().value_or(*containing)));
        OMLog::ops().debug("%s", entries.error().localizedDescription());
        return services;
    }
    for (const auto& entry : *entries) {
        if (entry.granted)
            services.insert(entry.service);
    }
    return services;
}

std::string OMDPlugIn::sandboxProfile() const
{
    const std::string* declared = pluginKey("QSExtensionPointIdentifier").asString();
    if (declared && *declared == kKeyboardExtensionPoint) {
        const bool openAccess = attribute("RequestsOpenAccess").asBool().value_or(false);
        if (openAccess && allowedConsentServices().contains(Consent::kKeyboardNetworkService))
            return "plugin";
        return "keyboard";
    }
    if (declared && *declared == "com.orvex.flowcheck.filter-data")
        return "network-filter";
    if (const std::string* point = plugInDictionary()["QSExtensionPointIdentifier"].asString()) {
        for (const auto& rule : kDictionaryProfiles) {
            if (*point == rule.extensionPoint)
                return rule.profile;
        }
    }
    return "plugin";
}

Value OMDPlugIn::launchEnvironment() const
{
    DictionaryBuilder environment;
    if (const auto& container = m_rgproxy->dataContainerPath()) {
        environment.set("HOME", *container);
        environment.set("VBFIXED_USER_HOME", *container);
        environment.set("TMPDIR", appendComponent(*container, "tmp"));
    } else {
        OMLog::ops().debug("no data container for plug-in %@(%@) %{public}@ at %@",
            Value::string(identifier().value_or(std::string())), version(), Value::uuid(registrationUuid()),
            Value::string(path().value_or(std::string())));
    }
    if (const char* sdk = std::getenv("OMTEST_SDK"))
        environment.set("OMTEST_SDK", sdk);
    return environment.build();
}

Value OMDPlugIn::serviceDescription(const Value& base, const std::string& profile) const
{
    DictionaryBuilder environment(base);
    const Value declared = infoKey("ConduitService");
    DictionaryBuilder description;
    if (declared.isDictionary()) {
        OMLog::rg().debug("raw ConduitService=%@", declared);
        description = DictionaryBuilder(declared);
    } else {
        OMLog::ops().info("no ConduitService for plug-in; database returned %@", declared);
    }
    for (const auto& [key, value] : description.get("EnvironmentVariables").entries())
        environment.set(key, value);
    description.set("EnvironmentVariables", environment.build());
    description.set("_SandboxProfile", profile);
    description.set("_OmitSandboxParameters", true);
    return description.build();
}

std::optional<OMError> OMDPlugIn::enableForClient(const OMDConduitClient& client) const
{
    const Value identifier = Value::string(this->identifier().value_or(std::string()));
    const Value uuid = Value::uuid(registrationUuid());
    const Value bundlePath = Value::string(path().value_or(std::string()));
    const Value hostPath = Value::string(client.path().value_or(std::string()));

    const Value environment = launchEnvironment();
    const std::string profile = sandboxProfile();
    const Value description = serviceDescription(environment, profile);
    OMLog::ops().info("assigning plug-in %@(%@) %{public}@ to %s sandbox", identifier, version(), uuid, profile);

    const Value overlay = Value::dictionary({
        { "ConduitService", ValueTreeConversion::toConduit(description).value_or(description) },
        { "VBBundlePackageType", "CND!" },
    });
    OMLog::ops().notice("allowing host %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@", client.pid(), hostPath,
        identifier, version(), uuid, bundlePath);

    auto bundle = OMBundle::initWithURL(url().value_or(std::string()));
    auto executable = bundle->executablePath();
    if (!executable) {
        OMLog::ops().error("failed to obtain execPath for plug-in %@(%{public}@) bundle=%@", identifier, uuid,
            Value::string(bundle->path().value_or(url().value_or(std::string()))));
        return OMMakeErrorWithFormat(4, "cannot obtain executable path for plug-in %@(%@)", identifier, uuid);
    }

    OMLog::ops().debug("activation overlay=%@", overlay);
    const int status = JobManagerAddService(client.auditToken(), *executable, overlay);
    if (status != kJobManagerSuccess) {
        OMLog::ops().error("jobd error %d trying to allow %d %@ to use plug-in %@(%@) uuid=%{public}@ at %@", status,
            client.pid(), hostPath, identifier, version(), uuid, bundlePath);
        return OMMakeErrorWithFormat(4, "unable to enable plug-in %@(%@)", identifier, uuid);
    }
    return std::nullopt;
}

} // namespace om

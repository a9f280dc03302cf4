// OMDPlugIn: the plug-in record the daemon works with, built from the Registrar's record of one
// registration. It keeps that record (rgproxy) and answers its key lookups, info dictionary and
// display names from it, so the daemon never reads a plug-in's bundle itself.
//
// The source is split by concern: OMDPlugIn.cpp (construction, lookups, entitlements, checks,
// the form's resource tokens, matching through OMMatcher with the user's elections) and
// OMDPlugInAccess.cpp (which hosts may use it).
#pragma once

#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>

#include "Ombrel/OMPlugInCore.h"
#include "platform/Registrar.h"

namespace om {

class OMDConduitClient;

class OMDPlugIn final : public OMPlugInCore {
public:
    // None when the Registrar's record has no bundle path or no identifier, or the plug-in fails
    // its configuration check (logged).
    static std::shared_ptr<OMDPlugIn> initWithRGData(std::shared_ptr<const RegistrarPlugInRecord> record);

    const std::shared_ptr<const RegistrarPlugInRecord>& rgproxy() const { return m_rgproxy; }
    // The UUID the Registrar gave the registration; present once constructed.
    const Uuid& registrationUuid() const { return m_rgproxy->uuid(); }

    Value infoKey(std::string_view key) const override;
    Value pluginKey(std::string_view key) const override;
    Value attribute(std::string_view key) const override;
    Value bundleInfoDictionary() const override;

    // Filled from the Registrar at the first read that finds them unset.
    std::optional<std::string> localizedName() const override;
    void setLocalizedName(std::optional<std::string> name) override;
    std::optional<std::string> localizedShortName() const override;
    void setLocalizedShortName(std::optional<std::string> name) override;
    std::optional<std::string> localizedContainingName() const override;
    void setLocalizedContainingName(std::optional<std::string> name) override;

    Value valueForEntitlement(std::string_view key) const;
    // Held unless absent, false or numerically zero.
    bool hasEntitlement(std::string_view key) const;
    // Where the plug-in's annotations live: the identifier it replaces (its
    // "com.orvex.developer.replace-plugin" entitlement, when a string), else its own.
    std::string annotationKey() const;

    // The core checks, then a data container for every plug-in that is not a data plug-in, and a
    // place in /System/ for a plug-in outside any application.
    std::optional<OMError> diagnose() const override;
    // A copy of info without the keys beginning "DT" (build facts).
    static Value prunedInfoDictionaryFor(const Value& info);

    // Attribute matching (OMMatcher), with elections read through the server's annotations.
    bool match(const Value& rules) const;
    bool matchKey(std::string_view key, const Value& pattern) const;
    static bool matchValuePatterns(const std::string& value, const Value& patterns);
    static bool matchValuePattern(const std::string& value, std::string_view pattern);
    static bool matchDictionaryPattern(const Value& value, const Value& pattern);

    // None when the host may use the plug-in; otherwise why not.
    std::optional<std::string> allowForClient(const OMDConduitClient& client) const;
    // A busy description ({kJobManagerBundleIdentifierKey: identifier}) when jobd reports a busy
    // instance of the plug-in; none otherwise, and when jobd cannot be asked (OMDPlugInBusy.cpp).
    std::optional<Value> checkBusy() const;

    // Lets the host launch the plug-in through the job manager (OMDPlugInLaunch.cpp). An error of
    // code 4 when the plug-in has no executable or the job manager refuses.
    std::optional<OMError> enableForClient(const OMDConduitClient& client) const;
    // The consent services the user granted to the containing application; empty when there is
    // none or the consent store cannot say.
    std::set<std::string> allowedConsentServices() const;

    // Adds "extensions": a token for each resource the plug-in shares ("." alone for an app
    // extension), when it shares any.
    void augmentForm(DictionaryBuilder& form) const;
    // Tokens for resources ("." for the bundle itself), keyed by name as given.
    Value issueResourceExtensions(const Value& resources) const;

private:
    // The launch environment before the declared variables: the data container and OMTEST_SDK.
    Value launchEnvironment() const;
    // The job manager's sandbox profile for this plug-in.
    std::string sandboxProfile() const;
    // The service description jobd receives: the declared "ConduitService" with the environment
    // (declared variables winning) and the profile over it.
    Value serviceDescription(const Value& base, const std::string& profile) const;

    explicit OMDPlugIn(std::shared_ptr<const RegistrarPlugInRecord> record)
        : m_rgproxy(std::move(record))
    {
    }

    const std::shared_ptr<const RegistrarPlugInRecord> m_rgproxy;
    mutable std::mutex m_namesMutex;
    mutable std::optional<std::string> m_localizedName;
    mutable std::optional<std::string> m_localizedShortName;
    mutable std::optional<std::string> m_localizedContainingName;
};

} // namespace om

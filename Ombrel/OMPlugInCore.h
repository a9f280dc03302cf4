// OMPlugInCore: the record that describes one installed plug-in — who it is, where it lives, what
// its bundle declares, how it is hosted — shared by the daemon (through its subclass) and by client
// programs, which rebuild it from its wire form.
//
// The record's source is split by concern: OMPlugInCore.cpp (fields, setup, derived properties,
// kinds, the configuration check), OMPlugInCoreSDK.cpp (merging the extension point's SDK entry)
// and OMPlugInCoreForm.cpp (the wire form).
//
// Every stored field is read and written whole under the record's own lock, so a reader on another
// queue sees either the old or the new value. Compound updates (setDictionaries, canonicalize,
// resolveSDK) are not atomic as a whole: they run while one party owns the record, during
// construction. A subclass answers the key lookups, the info dictionary and the display names its
// own way by overriding the virtual members; every derived property goes through them.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/OMError.h"
#include "platform/Uuid.h"
#include "platform/Value.h"

namespace om {

class OMPlugInCore {
public:
    // The code of every error diagnose() reports.
    static constexpr int64_t kMisconfiguredErrorCode = 12;

    virtual ~OMPlugInCore() = default;
    OMPlugInCore(const OMPlugInCore&) = delete;
    OMPlugInCore& operator=(const OMPlugInCore&) = delete;

    // Construction and setup. url is a "file://" URL; bundleInfo and info are dictionaries or none.
    // Null when setup refuses (see setupWithName).
    static std::shared_ptr<OMPlugInCore> initWithName(const std::optional<std::string>& name,
        const std::optional<std::string>& url, const Value& bundleInfo, const Value& info,
        const std::optional<Uuid>& uuid);
    // Sets identifier, url and uuid (a random one when none is given), and the dictionaries from
    // bundleInfo when one is given. info is accepted and not read. False, with nothing else set,
    // for a missing url (silently) or name (logged); false when bundleInfo is malformed (logged).
    bool setupWithName(const std::optional<std::string>& name, const std::optional<std::string>& url,
        const Value& bundleInfo, const Value& info, const std::optional<Uuid>& uuid);
    // Stores info as the bundle info dictionary and its "QSExtension" dictionary as the plug-in
    // dictionary. False when info is no dictionary, or has no "QSExtension" dictionary (in which
    // case the bundle info dictionary has already been replaced).
    bool setDictionaries(const Value& info);
    // Whatever a subclass needs to make of an info dictionary before it is stored; this class
    // stores it unchanged.
    virtual Value normalizeInfoDictionary(const Value& info) const;
    // Makes the plug-in dictionary hold an attributes dictionary, and that a "QSExtensionVersion".
    void canonicalize();

    // Key lookups; none when absent. Every other operation goes through these three.
    virtual Value infoKey(std::string_view key) const;
    virtual Value pluginKey(std::string_view key) const;
    virtual Value attribute(std::string_view key) const;

    // Stored fields.
    std::optional<std::string> identifier() const;
    void setIdentifier(std::optional<std::string> identifier);
    std::optional<std::string> originalIdentifier() const;
    void setOriginalIdentifier(std::optional<std::string> originalIdentifier);
    std::optional<std::string> url() const;
    void setUrl(std::optional<std::string> url);
    virtual Value bundleInfoDictionary() const;
    void setBundleInfoDictionary(Value bundleInfoDictionary);
    Value plugInDictionary() const;
    void setPlugInDictionary(Value plugInDictionary);
    Value entitlements() const;
    void setEntitlements(Value entitlements);
    Value annotations() const;
    void setAnnotations(Value annotations);
    std::optional<std::string> containingUrl() const;
    void setContainingUrl(std::optional<std::string> containingUrl);
    bool onSystemVolume() const;
    void setOnSystemVolume(bool onSystemVolume);
    uint32_t hubProtocolVersion() const;
    void setHubProtocolVersion(uint32_t hubProtocolVersion);
    virtual std::optional<std::string> localizedName() const;
    virtual void setLocalizedName(std::optional<std::string> localizedName);
    virtual std::optional<std::string> localizedShortName() const;
    virtual void setLocalizedShortName(std::optional<std::string> localizedShortName);
    virtual std::optional<std::string> localizedContainingName() const;
    virtual void setLocalizedContainingName(std::optional<std::string> localizedContainingName);
    // Registration time, whole seconds since 1970-01-01 UTC.
    int32_t lastModified() const;
    void setLastModified(int32_t lastModified);
    // Present once setup has succeeded.
    std::optional<Uuid> uuid() const;
    void setUuid(std::optional<Uuid> uuid);
    std::optional<std::vector<uint8_t>> cdhash() const;
    void setCdhash(std::optional<std::vector<uint8_t>> cdhash);
    std::optional<std::string> requirement() const;
    void setRequirement(std::optional<std::string> requirement);

    // Derived, computed at every read.
    bool oldStyle() const;
    std::optional<std::string> path() const;
    std::optional<std::string> containingPath() const;
    Value attributes() const;
    Value version() const;
    Value protocolSpec() const;
    Value principalSpec() const;
    Value sdkSpec() const;
    Value embeddedProtocolSpec() const;
    virtual std::optional<std::string> embeddedCodePath() const;
    std::chrono::sys_seconds timestamp() const;

    // Kinds, each independent of the others.
    bool isAppExtension() const;
    bool isMultiplexed() const;
    bool isHybrid() const;
    bool isDedicated() const;
    bool isData() const;

    // The first check a well-formed plug-in fails, as an error of kMisconfiguredErrorCode.
    virtual std::optional<OMError> diagnose() const;
    // Hook for the description of the interface a host talks to the plug-in through; nothing
    // supplies one yet, and this class adds nothing to it.
    virtual void augmentInterface(const Value& interface);

    // Identity is the registration: the UUID alone.
    bool isEqual(const OMPlugInCore& other) const;
    size_t hash() const;
    bool operator==(const OMPlugInCore& other) const { return isEqual(other); }

    // For unordered containers of records held by any kind of pointer.
    struct Hash {
        template <typename Pointer> size_t operator()(const Pointer& record) const { return record->hash(); }
    };
    struct Equal {
        template <typename Pointer> bool operator()(const Pointer& a, const Pointer& b) const
        {
            return a == b || (a && b && a->isEqual(*b));
        }
    };

    // SDK resolution: merges the SDK entry of the plug-in's extension point into the info
    // dictionary, then canonicalizes. Needs the record's own info dictionary.
    void resolveSDK();
    // The SDK entry of an extension point, or none (logged).
    static Value readSDKDictionary(std::string_view name);
    // sdk merged into the plug-in side by the DictionaryMerge rules, with this record's
    // sdkOverridesKey deciding which keys the SDK's value wins.
    Value mergeDictionary(const Value& sdk, const Value& into) const;
    // True for the keys whose SDK value replaces the plug-in's.
    virtual bool sdkOverridesKey(std::string_view key) const;
    static Value mergeSharedResources(const Value& sdk, const Value& into);

    // Wire form. "export" is a C++ keyword, hence exportForm. The form, or none when a base value
    // is absent; error is never filled (a caller that reports filled errors keeps one path).
    Value exportForm(std::optional<OMError>* error = nullptr) const;
    static std::shared_ptr<OMPlugInCore> initWithForm(const Value& form);
    bool setupWithForm(const Value& form);
    void updateFromForm(const Value& form);
    // A none value removes the key. A record without annotations starts an empty dictionary.
    void setAnnotation(std::string_view key, const Value& value);

protected:
    // The bare record: every field absent, onSystemVolume false, numbers 0.
    OMPlugInCore() = default;

    // initWithName's steps on a record that is already made, so that a subclass can construct
    // itself the same way: setup, then the plug-in dictionary from info when setup left none.
    bool constructWithName(const std::optional<std::string>& name, const std::optional<std::string>& url,
        const Value& bundleInfo, const Value& info, const std::optional<Uuid>& uuid);
    // The SDK entry resolveSDK merges; a subclass may supply entries its own way.
    virtual Value sdkDictionaryNamed(std::string_view name) const;

    // The boolean reading of a declared value: a number is true when not 0; a string is true when
    // it starts (after blanks, a sign and zeros) with Y, y, T, t or a digit 1-9; anything else false.
    static bool boolValue(const Value& value);

private:
    template <typename T> T read(const T& field) const
    {
        std::lock_guard lock(m_mutex);
        return field;
    }
    template <typename T> void write(T& field, T value)
    {
        std::lock_guard lock(m_mutex);
        field = std::move(value);
    }

    mutable std::mutex m_mutex;
    std::optional<std::string> m_identifier;
    std::optional<std::string> m_originalIdentifier;
    std::optional<std::string> m_url;
    Value m_bundleInfoDictionary;
    Value m_plugInDictionary;
    Value m_entitlements;
    Value m_annotations;
    std::optional<std::string> m_containingUrl;
    bool m_onSystemVolume = false;
    uint32_t m_hubProtocolVersion = 0;
    std::optional<std::string> m_localizedName;
    std::optional<std::string> m_localizedShortName;
    std::optional<std::string> m_localizedContainingName;
    int32_t m_lastModified = 0;
    std::optional<Uuid> m_uuid;
    std::optional<std::vector<uint8_t>> m_cdhash;
    std::optional<std::string> m_requirement;
};

} // namespace om

template <> struct std::hash<om::OMPlugInCore> {
    size_t operator()(const om::OMPlugInCore& record) const { return record.hash(); }
};

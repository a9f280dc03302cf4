// One registered plug-in as the Registrar reports it. Immutable once made and shared: a record held
// by a reader stays valid after the registration it describes has changed or gone.
//
// The dictionaries are canonical: the extension point's SDK entry is merged in (DictionaryMerge),
// and the plug-in dictionary always holds "QSExtensionAttributes" with "QSExtensionVersion".
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/RegistrarAppRecord.h"
#include "platform/Uuid.h"
#include "platform/Value.h"

namespace om {

// The dictionary a keyed lookup reads.
enum class RegistrarScope : uint8_t {
    Attributes = 0, // the plug-in dictionary's "QSExtensionAttributes"
    PlugIn = 1, // the plug-in dictionary
    Info = 2, // the bundle's whole info dictionary
};

class RegistrarPlugInRecord {
public:
    struct Facts {
        Uuid uuid;
        std::optional<std::string> bundlePath; // canonical; absent only in records made by hand
        std::optional<std::string> identifier; // QSExtensionIdentifier, else VBBundleIdentifier
        std::optional<std::string> originalIdentifier; // VBBundleIdentifier, else the identifier
        std::optional<std::string> bundleIdentifier; // VBBundleIdentifier
        std::optional<std::string> bundleVersion; // VBBundleVersion
        Value infoDictionary; // canonical
        Value plugInDictionary; // canonical
        Value entitlements; // dictionary; none when the executable grants none
        std::optional<double> registrationDate; // seconds since 1970-01-01 UTC
        bool onSystemPartition = false; // the path begins with "/System/"
        std::shared_ptr<const RegistrarAppRecord> containingApp;
        std::optional<std::string> displayName;
        std::optional<std::string> shortDisplayName;
        std::optional<std::string> dataContainerPath;
        uint64_t sequence = 0; // registration order, for listing in a stable order
    };

    explicit RegistrarPlugInRecord(Facts facts);

    const Uuid& uuid() const { return m_facts.uuid; }
    const std::optional<std::string>& bundlePath() const { return m_facts.bundlePath; }
    const std::optional<std::string>& identifier() const { return m_facts.identifier; }
    const std::optional<std::string>& originalIdentifier() const { return m_facts.originalIdentifier; }
    const std::optional<std::string>& bundleIdentifier() const { return m_facts.bundleIdentifier; }
    const std::optional<std::string>& bundleVersion() const { return m_facts.bundleVersion; }
    const Value& infoDictionary() const { return m_facts.infoDictionary; }
    const Value& plugInDictionary() const { return m_facts.plugInDictionary; }
    const Value& entitlements() const { return m_facts.entitlements; }
    const std::optional<double>& registrationDate() const { return m_facts.registrationDate; }
    bool onSystemPartition() const { return m_facts.onSystemPartition; }
    const std::shared_ptr<const RegistrarAppRecord>& containingApp() const { return m_facts.containingApp; }
    const std::optional<std::string>& displayName() const { return m_facts.displayName; }
    const std::optional<std::string>& shortDisplayName() const { return m_facts.shortDisplayName; }
    const std::optional<std::string>& dataContainerPath() const { return m_facts.dataContainerPath; }
    uint64_t sequence() const { return m_facts.sequence; }
    const Facts& facts() const { return m_facts; }

    // The value of key in the scope's dictionary, or none. The attributes scope also answers
    // "QSExtensionPointIdentifier" from the plug-in dictionary when the attributes lack it, so that
    // a host's rule on the extension point matches.
    Value lookup(std::string_view key, RegistrarScope scope) const;

    // "<RegistrarPlugInRecord identifier UUID path>", for log lines.
    std::string description() const;

private:
    const Facts m_facts;
};

using RegistrarPlugInRecords = std::vector<std::shared_ptr<const RegistrarPlugInRecord>>;

} // namespace om

// The Registrar's in-memory indexes of registered plug-ins: by UUID, bundle path, containing
// application, identifier and extension point, plus registration order.
//
// Identifiers and extension points are indexed by VersionString::equivalenceKey, because the
// daemon's matcher compares texts with digit runs taken as numbers ("com.a01" equals "com.a1"):
// the index must find every plug-in such a rule keeps, so that narrowing never changes an answer.
//
// Not synchronised: the workspace guards it.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/RegistrarAppRecord.h"
#include "platform/RegistrarPlugInRecord.h"
#include "platform/Uuid.h"
#include "platform/Value.h"

namespace om {

class RegistrarIndex {
public:
    using Record = std::shared_ptr<const RegistrarPlugInRecord>;
    using Application = std::shared_ptr<const RegistrarAppRecord>;

    // A record with a sequence above every other, or the same path as none other.
    void insert(const Record& record);
    // Nothing happens when no record has that UUID.
    void remove(const Uuid& uuid);

    Record withUuid(const Uuid& uuid) const;
    Record atPath(std::string_view canonicalPath) const;
    Application application(std::string_view path) const;
    RegistrarPlugInRecords plugInsOfApplication(std::string_view path) const; // path order
    RegistrarPlugInRecords all() const; // registration order
    std::vector<Application> applications() const; // path order
    size_t count() const { return m_byUuid.size(); }

    // The records a rules dictionary may select, in registration order: narrowed by the
    // "QSExtensionPointIdentifier" and "QSExtensionIdentifier" rules where both indexes can answer
    // them exactly, every record otherwise.
    RegistrarPlugInRecords candidates(const Value& rules) const;

    // The equivalence keys a pattern selects by equality: a plain text, "=" and its operand, or an
    // array of only those. None for any pattern an index cannot answer (an operator, a number, a
    // boolean, a dictionary, an array with any other element).
    static std::optional<std::vector<std::string>> equalityKeys(const Value& pattern);
    // The value the daemon's matcher sees for the extension point: the attributes lookup, else the
    // info dictionary's.
    static Value extensionPointValue(const RegistrarPlugInRecord& record);

private:
    using Bucket = std::vector<Record>; // registration order
    using KeyIndex = std::unordered_map<std::string, Bucket>;

    struct ApplicationEntry {
        Application record;
        std::vector<Record> plugIns; // path order
    };

    static std::vector<std::string> extensionPointKeys(const RegistrarPlugInRecord& record);
    static void add(KeyIndex& index, const std::string& key, const Record& record);
    static void drop(KeyIndex& index, const std::string& key, const Uuid& uuid);
    static std::optional<Bucket> lookUp(const KeyIndex& index, const Value& pattern);

    std::unordered_map<Uuid, Record> m_byUuid;
    // Keys view the records' own paths, which live as long as their entries.
    std::unordered_map<std::string_view, Record> m_byPath;
    std::map<uint64_t, Record> m_bySequence;
    std::map<std::string, ApplicationEntry, std::less<>> m_applications;
    KeyIndex m_byIdentifier;
    KeyIndex m_byExtensionPoint;
};

} // namespace om

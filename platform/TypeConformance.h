// Type conformance: whether one type identifier (a MIME type) is a kind of another.
//
// The relation is the shared-mime-info database's: "child parent" lines of mime/subclasses and
// "alias canonical" lines of mime/aliases under each data directory, plus the implicit rules that
// every text/* type conforms to text/plain and every type to application/octet-stream. Types
// compare case-insensitively, and an alias stands for its canonical type.
//
// A database is immutable once built, so one instance serves any number of threads.
#pragma once

#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

namespace om {

class TypeConformance {
public:
    // Longer type strings are no type at all: they conform to nothing and nothing conforms to them.
    static constexpr size_t kMaxTypeLength = 255;
    // A database file past this size is ignored (the real ones are a few tens of kilobytes).
    static constexpr size_t kMaxFileSize = 4 * 1024 * 1024;

    // The database of this machine: mime/ under $XDG_DATA_HOME and each directory of $XDG_DATA_DIRS
    // (default "/usr/local/share:/usr/share"), read on first use, once per process.
    static const TypeConformance& shared();
    // Reads mime/subclasses and mime/aliases under each of dataDirectories, the first taking
    // precedence for aliases. Missing, unreadable or oversized files contribute nothing; lines that
    // are not two well-formed types are skipped one by one.
    static TypeConformance fromDirectories(const std::vector<std::string>& dataDirectories);

    // The types a type is a kind of, for testing one type against many without walking the
    // database again each time. Empty for a string that is no type.
    struct Lineage {
        std::unordered_set<std::string> types; // the canonical type and all its supertypes
        bool isText = false; // one of them is text/*

        // True when the type conforms to canonicalType (as canonical() gives it).
        bool conformsTo(const std::string& canonicalType) const;
    };

    // True when type conforms to `to` by the database and the implicit rules.
    bool conforms(std::string_view type, std::string_view to) const;
    Lineage lineage(std::string_view type) const;

    // The type in lower case with an alias replaced by its canonical type; empty for a string that
    // is no type (empty, too long, without exactly one '/', or holding space or control bytes).
    std::string canonical(std::string_view type) const;

private:
    TypeConformance() = default;
    void readSubclasses(const std::string& path);
    void readAliases(const std::string& path);

    std::unordered_map<std::string, std::string> m_aliases; // alias -> canonical, both lower case
    std::unordered_map<std::string, std::vector<std::string>> m_parents; // canonical -> canonical parents
};

} // namespace om

// OMDMatchResults: the reply of one "match" request while it is being built. It keeps at most one
// form per identifier unless the host asks for every version (duplicate resolution), and links the
// forms of plug-ins that replace others with the forms they replace (overrides).
#pragma once

#include <cstdint>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/Value.h"

namespace om {

class OMDMatchResults {
public:
    static constexpr uint64_t kDiscoverAllVersions = 0x1;
    static constexpr uint64_t kDiscoverSameVersions = 0x4;

    explicit OMDMatchResults(uint64_t flags)
        : m_flags(flags)
    {
    }

    // Resolves a new plug-in's form against the forms of its identifier already kept, in order.
    // Yes when the new form is to be kept; a form it supersedes is taken out.
    bool admit(const Value& form);

    // Appends a form that admit accepted, completed by the caller. replaced is the plug-in's
    // replacement entitlement: an identifier or an array of them that this form overrides.
    void append(DictionaryBuilder form, const Value& replaced);

    // Marks each overridden form with its overrider's UUID and the overrider with what it
    // overrides, then hands out the kept forms in the order they were appended.
    Value finish();

private:
    struct Entry {
        DictionaryBuilder form;
        std::string identifier;
        std::string uuid;
        std::string version;
        bool systemResident = false;
        int64_t lastModified = 0;
        bool removed = false;
    };

    static Entry entryFor(const Value& form);

    uint64_t m_flags;
    std::vector<Entry> m_entries;
    std::unordered_map<std::string, size_t> m_overrides; // identifier -> index of its overrider
};

} // namespace om

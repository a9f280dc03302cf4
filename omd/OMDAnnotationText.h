// OMDAnnotationText: the annotation database's file text, kept up to date entry by entry. A save
// after one change writes the text of that one entry anew and copies the others' from the last
// save, instead of writing the whole table again; the result is byte for byte the XML vlist of
// {"version": version, "data": table}.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <unordered_map>

#include "platform/Value.h"

namespace om {

class OMDAnnotationText {
public:
    // The file's text for the table. Valid until the next call.
    const std::string& compose(const std::map<std::string, Value>& table, int64_t version);
    // The entry under key has changed or gone.
    void forget(const std::string& key) { m_entries.erase(key); }
    void clear() { m_entries.clear(); }

private:
    void frame(int64_t version);

    std::optional<int64_t> m_frameVersion;
    std::string m_before; // the text ahead of the first entry
    std::string m_after; // and after the last
    std::unordered_map<std::string, std::string> m_entries; // key -> its lines in the file
    std::string m_text; // kept, so that a large table is not written into fresh pages each time
};

} // namespace om

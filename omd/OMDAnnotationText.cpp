#include "omd/OMDAnnotationText.h"

#include "platform/Vlist.h"
#include "platform/VlistXmlWriter.h"

namespace om {

namespace {

constexpr unsigned kEntryLevel = 2; // <vlist> <dict> "data" <dict> entry

} // namespace

// What the writer puts before and after the entries of the table, found by writing a table of
// one known entry: the layout is the writer's alone.
void OMDAnnotationText::frame(int64_t version)
{
    if (m_frameVersion == version)
        return;
    const Value marker = Value::integer(0);
    const std::string whole = Vlist::writeXml(Value::dictionary(
        { { "version", Value::integer(version) }, { "data", Value::dictionary({ { "m", marker } }) } }));
    std::string entry;
    VlistXmlWriter::appendDictionaryEntry(entry, "m", marker, kEntryLevel);
    const size_t at = whole.find(entry);
    m_before = whole.substr(0, at);
    m_after = whole.substr(at + entry.size());
    m_frameVersion = version;
}

const std::string& OMDAnnotationText::compose(const std::map<std::string, Value>& table, int64_t version)
{
    bool exactKeys = !table.empty();
    for (auto it = table.begin(); exactKeys && it != table.end(); ++it)
        exactKeys = VlistXmlWriter::representable(it->first);
    if (!exactKeys) {
        // An empty table is written on one line; keys that need replacement characters may
        // become alike, and the writer decides which one stays.
        std::vector<Value::Entry> entries(table.begin(), table.end());
        m_text = Vlist::writeXml(Value::dictionary(
            { { "version", Value::integer(version) }, { "data", Value::dictionary(std::move(entries)) } }));
        return m_text;
    }
    frame(version);
    m_text.clear();
    m_text += m_before;
    for (const auto& [key, annotation] : table) {
        auto [cached, isNew] = m_entries.try_emplace(key);
        if (isNew)
            VlistXmlWriter::appendDictionaryEntry(cached->second, key, annotation, kEntryLevel);
        m_text += cached->second;
    }
    m_text += m_after;
    return m_text;
}

} // namespace om

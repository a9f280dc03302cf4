#include "platform/RegistrarIndex.h"

#include <algorithm>
#include <span>

#include "platform/VersionString.h"

namespace om {

namespace {

bool bySequence(const RegistrarIndex::Record& a, const RegistrarIndex::Record& b)
{
    return a->sequence() < b->sequence();
}

bool byPath(const RegistrarIndex::Record& a, const RegistrarIndex::Record& b)
{
    return a->bundlePath() < b->bundlePath();
}

// The operand of a pattern that selects by equality alone, as the matcher reads its operators.
std::optional<std::string_view> equalityOperand(const Value& pattern)
{
    const std::string* text = pattern.asString();
    if (!text)
        return std::nullopt;
    std::string_view view(*text);
    if (view.starts_with('='))
        return view.substr(1);
    if (view.starts_with('?') || view.starts_with('<') || view.starts_with('>'))
        return std::nullopt;
    return view;
}

} // namespace

std::optional<std::vector<std::string>> RegistrarIndex::equalityKeys(const Value& pattern)
{
    if (!pattern.isString() && !pattern.isArray())
        return std::nullopt;
    // A single pattern counts as a list of one.
    const auto patterns = pattern.isString() ? std::span<const Value>(&pattern, 1) : pattern.elements();
    std::vector<std::string> keys;
    for (const Value& element : patterns) {
        auto operand = equalityOperand(element);
        if (!operand)
            return std::nullopt;
        keys.push_back(VersionString::equivalenceKey(*operand));
    }
    return keys;
}

Value RegistrarIndex::extensionPointValue(const RegistrarPlugInRecord& record)
{
    Value value = record.lookup("QSExtensionPointIdentifier", RegistrarScope::Attributes);
    return value.isNone() ? record.lookup("QSExtensionPointIdentifier", RegistrarScope::Info) : value;
}

std::vector<std::string> RegistrarIndex::extensionPointKeys(const RegistrarPlugInRecord& record)
{
    Value value = extensionPointValue(record);
    std::vector<std::string> keys;
    if (const std::string* text = value.asString())
        keys.push_back(VersionString::equivalenceKey(*text));
    for (const Value& element : value.elements()) {
        if (const std::string* text = element.asString())
            keys.push_back(VersionString::equivalenceKey(*text));
    }
    // An array naming one point twice must not list the record twice under it.
    std::sort(keys.begin(), keys.end());
    keys.erase(std::unique(keys.begin(), keys.end()), keys.end());
    return keys;
}

void RegistrarIndex::add(KeyIndex& index, const std::string& key, const Record& record)
{
    Bucket& bucket = index[key];
    bucket.insert(std::upper_bound(bucket.begin(), bucket.end(), record, bySequence), record);
}

void RegistrarIndex::drop(KeyIndex& index, const std::string& key, const Uuid& uuid)
{
    auto found = index.find(key);
    if (found == index.end())
        return;
    std::erase_if(found->second, [&](const Record& record) { return record->uuid() == uuid; });
    if (found->second.empty())
        index.erase(found);
}

void RegistrarIndex::insert(const Record& record)
{
    m_byUuid[record->uuid()] = record;
    m_bySequence[record->sequence()] = record;
    if (record->bundlePath())
        m_byPath[*record->bundlePath()] = record;
    if (record->identifier())
        add(m_byIdentifier, VersionString::equivalenceKey(*record->identifier()), record);
    for (const std::string& key : extensionPointKeys(*record))
        add(m_byExtensionPoint, key, record);
    if (const Application& application = record->containingApp()) {
        ApplicationEntry& entry = m_applications[application->path()];
        entry.record = application; // the latest reading of the application's Info.vlist
        entry.plugIns.insert(std::upper_bound(entry.plugIns.begin(), entry.plugIns.end(), record, byPath), record);
    }
}

void RegistrarIndex::remove(const Uuid& uuid)
{
    auto found = m_byUuid.find(uuid);
    if (found == m_byUuid.end())
        return;
    Record record = found->second;
    m_byUuid.erase(found);
    m_bySequence.erase(record->sequence());
    if (record->bundlePath())
        m_byPath.erase(*record->bundlePath());
    if (record->identifier())
        drop(m_byIdentifier, VersionString::equivalenceKey(*record->identifier()), uuid);
    for (const std::string& key : extensionPointKeys(*record))
        drop(m_byExtensionPoint, key, uuid);
    if (const Application& application = record->containingApp()) {
        auto entry = m_applications.find(application->path());
        if (entry != m_applications.end()) {
            std::erase_if(entry->second.plugIns, [&](const Record& plugIn) { return plugIn->uuid() == uuid; });
            if (entry->second.plugIns.empty())
                m_applications.erase(entry);
        }
    }
}

RegistrarIndex::Record RegistrarIndex::withUuid(const Uuid& uuid) const
{
    auto found = m_byUuid.find(uuid);
    return found == m_byUuid.end() ? nullptr : found->second;
}

RegistrarIndex::Record RegistrarIndex::atPath(std::string_view canonicalPath) const
{
    auto found = m_byPath.find(canonicalPath);
    return found == m_byPath.end() ? nullptr : found->second;
}

RegistrarIndex::Application RegistrarIndex::application(std::string_view path) const
{
    auto found = m_applications.find(path);
    return found == m_applications.end() ? nullptr : found->second.record;
}

RegistrarPlugInRecords RegistrarIndex::plugInsOfApplication(std::string_view path) const
{
    auto found = m_applications.find(path);
    return found == m_applications.end() ? RegistrarPlugInRecords() : found->second.plugIns;
}

RegistrarPlugInRecords RegistrarIndex::all() const
{
    RegistrarPlugInRecords records;
    records.reserve(m_bySequence.size());
    for (const auto& entry : m_bySequence)
        records.push_back(entry.second);
    return records;
}

std::vector<RegistrarIndex::Application> RegistrarIndex::applications() const
{
    std::vector<Application> records;
    records.reserve(m_applications.size());
    for (const auto& entry : m_applications)
        records.push_back(entry.second.record);
    return records;
}

std::optional<RegistrarIndex::Bucket> RegistrarIndex::lookUp(const KeyIndex& index, const Value& pattern)
{
    auto keys = equalityKeys(pattern);
    if (!keys)
        return std::nullopt;
    Bucket found;
    for (const std::string& key : *keys) {
        auto bucket = index.find(key);
        if (bucket != index.end())
            found.insert(found.end(), bucket->second.begin(), bucket->second.end());
    }
    std::sort(found.begin(), found.end(), bySequence);
    found.erase(std::unique(found.begin(), found.end()), found.end());
    return found;
}

RegistrarPlugInRecords RegistrarIndex::candidates(const Value& rules) const
{
    std::optional<Bucket> narrowed;
    for (auto [key, index] : { std::pair { "QSExtensionPointIdentifier", &m_byExtensionPoint },
             std::pair { "QSExtensionIdentifier", &m_byIdentifier } }) {
        const Value& pattern = rules[key];
        if (pattern.isNone())
            continue;
        auto found = lookUp(*index, pattern);
        if (!found)
            continue;
        if (!narrowed) {
            narrowed = std::move(found);
            continue;
        }
        Bucket both;
        std::set_intersection(
            narrowed->begin(), narrowed->end(), found->begin(), found->end(), std::back_inserter(both), bySequence);
        narrowed = std::move(both);
    }
    return narrowed ? std::move(*narrowed) : all();
}

} // namespace om

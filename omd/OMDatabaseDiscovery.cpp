// The discovery query's candidate search: the Registrar's records for a host's rules, with the
// election prefilter pushed into the Registrar's query, turned into cached daemon records.
#include <algorithm>
#include <cmath>
#include <span>
#include <unordered_map>
#include <unordered_set>

#include "Ombrel/OMLog.h"
#include "omd/OMDAnnotationStore.h"
#include "omd/OMDPlugIn.h"
#include "omd/OMDatabase.h"

namespace om {

namespace {

constexpr const char* kReplacePluginEntitlement = "com.orvex.developer.replace-plugin";
constexpr const char* kAutoElectEntitlement = "com.orvex.developer.auto-elect-plugin";

bool isAsciiAlphanumeric(unsigned char c)
{
    return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z');
}

// The first code point of text is a letter, mark or digit. Election patterns are texts of
// numbers, so ASCII decides every pattern that can select anything; any other leading code point
// is taken as a letter, which only ever pushes down a text that matches no election.
bool beginsWithLetterMarkOrDigit(const std::string& text)
{
    const auto first = static_cast<unsigned char>(text.front());
    if (first < 0x80)
        return isAsciiAlphanumeric(first);
    return true;
}

// The text a pattern pushes down, or none when it cannot be pushed.
std::optional<std::string> pushedDown(const Value& pattern)
{
    const std::string* text = pattern.asString();
    if (!text || text->empty())
        return std::nullopt;
    if (text->front() == '=')
        return text->substr(1);
    if (beginsWithLetterMarkOrDigit(*text))
        return *text;
    return std::nullopt;
}

} // namespace

std::optional<std::vector<std::string>> OMDatabase::electionPrefilter(const Value& rules)
{
    const Value& election = rules["QSUserElection"];
    if (!election.isString() && !election.isArray())
        return std::nullopt;
    // A single pattern counts as a list of one.
    const auto patterns = election.isString() ? std::span<const Value>(&election, 1) : election.elements();
    std::vector<std::string> texts;
    for (const Value& pattern : patterns) {
        auto text = pushedDown(pattern);
        if (!text)
            return std::nullopt;
        texts.push_back(std::move(*text));
    }
    return texts;
}

bool OMDatabase::passesPrefilter(
    const std::vector<std::string>& prefilter, const std::string& identifier, const Value& entitlements) const
{
    const std::string* replaced = entitlements[kReplacePluginEntitlement].asString();
    const std::string& key = replaced ? *replaced : identifier;
    const Value annotation = m_annotations->annotationForIdentifier(key);
    int64_t election = 0;
    if (annotation.contains("election")) {
        const Value& value = annotation["election"];
        if (auto integer = value.asInt64())
            election = *integer;
        else if (auto number = value.asUInt64())
            election = static_cast<int64_t>(*number);
        else if (auto real = value.asDouble(); real && std::fabs(*real) < 9.0e18)
            election = static_cast<int64_t>(*real); // NaN and values out of range stay 0
    } else {
        const Value& autoElect = entitlements[kAutoElectEntitlement];
        election = autoElect.isNumber() && !autoElect.numericallyEquals(0) ? 1 : 0;
    }
    const std::string text = std::to_string(static_cast<uint64_t>(election) & 0xff);
    const bool kept = std::find(prefilter.begin(), prefilter.end(), text) != prefilter.end();
    OMLog::ops().debug("rg filter %@ -> %d", key, kept ? 1 : 0);
    return kept;
}

std::optional<OMDPlugIns> OMDatabase::findPlugIns(const Value& rules)
{
    RegistrarPlugInRecords records;
    if (!rules.isDictionary() || rules.count() == 0) {
        records = m_workspace->allPlugIns();
        if (OMLog::rg().enabled(LogLevel::Debug))
            OMLog::rg().debug("%d installedPlugins: %@", static_cast<int>(records.size()), describe(records));
    } else {
        auto prefilter = electionPrefilter(rules);
        RegistrarWorkspace::CandidateFilter filter;
        if (prefilter) {
            filter = [this, &prefilter](const std::string& identifier, const Value& entitlements) {
                return passesPrefilter(*prefilter, identifier, entitlements);
            };
        }
        records = m_workspace->query(rules, filter);
        if (OMLog::rg().enabled(LogLevel::Debug)) {
            OMLog::rg().debug(
                "%d plugin(s) matching %@ = %@", static_cast<int>(records.size()), rules, describe(records));
        }
    }
    const size_t cachedBefore = m_cachedCount.load(std::memory_order_relaxed);
    OMDPlugIns found;
    std::unordered_set<Uuid> seen;
    // Whether an application is complete is read from the disk, once per application and query:
    // its plug-ins share its record.
    std::unordered_map<const RegistrarAppRecord*, bool> placeholders;
    const auto isPlaceholder = [&](const RegistrarAppRecord& app) {
        auto [entry, isNew] = placeholders.try_emplace(&app, false);
        if (isNew)
            entry->second = app.isPlaceholder();
        return entry->second;
    };
    for (const auto& record : records) {
        if (!record->bundlePath()) {
            OMLog::ops().info("skipping rg proxy %@ with nil bundleURL", record->description());
            continue;
        }
        if (const auto& app = record->containingApp(); app && isPlaceholder(*app)) {
            OMLog::ops().info("skipping rg proxy %@ because its app is a placeholder", record->description());
            continue;
        }
        if (!seen.insert(record->uuid()).second)
            continue;
        if (auto plugIn = plugInForProxy(record))
            found.push_back(std::move(plugIn));
    }
    OMLog::ops().debug("RG reported %u plug-ins (cache %u/%u)", static_cast<unsigned>(found.size()),
        static_cast<unsigned>(cachedBefore), static_cast<unsigned>(m_cachedCount.load(std::memory_order_relaxed)));
    if (records.empty())
        return std::nullopt;
    return found;
}

Value OMDatabase::describe(const RegistrarPlugInRecords& records)
{
    ArrayBuilder described;
    for (const auto& record : records)
        described.append(Value::string(record->description()));
    return described.build();
}

} // namespace om

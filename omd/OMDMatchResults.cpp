#include "omd/OMDMatchResults.h"

#include "Ombrel/OMLog.h"
#include "Ombrel/OMVersionString.h"

namespace om {

namespace {

std::string text(const Value& value)
{
    const std::string* string = value.asString();
    return string ? *string : std::string();
}

} // namespace

OMDMatchResults::Entry OMDMatchResults::entryFor(const Value& form)
{
    return Entry { DictionaryBuilder(form), text(form["identifier"]), text(form["uuid"]), text(form["version"]),
        form["systemResident"].asBool().value_or(false), form["lastmodified"].asInt64().value_or(0) };
}

bool OMDMatchResults::admit(const Value& form)
{
    const Entry candidate = entryFor(form);
    const bool allVersions = (m_flags & kDiscoverAllVersions) != 0;
    for (auto& existing : m_entries) {
        if (existing.removed || existing.identifier != candidate.identifier)
            continue;
        const int order = compareVersionString(candidate.version, existing.version);
        if (allVersions && (order != 0 || (m_flags & kDiscoverSameVersions)))
            continue;
        // At equal versions the system volume wins over a rival outside it, else the later
        // modification; a tie keeps the form found first.
        const bool newer = order > 0
            || (order == 0
                && ((candidate.systemResident && !existing.systemResident)
                    || candidate.lastModified > existing.lastModified));
        if (!newer)
            return false;
        existing.removed = true;
        return true;
    }
    return true;
}

void OMDMatchResults::append(DictionaryBuilder form, const Value& replaced)
{
    m_entries.push_back(entryFor(form.build()));
    const size_t index = m_entries.size() - 1;
    if (const std::string* name = replaced.asString())
        m_overrides[*name] = index;
    for (const Value& element : replaced.elements()) {
        if (const std::string* name = element.asString())
            m_overrides[*name] = index;
    }
}

Value OMDMatchResults::finish()
{
    // A replacement that duplicate resolution took out again still names what it replaces.
    for (auto& entry : m_entries) {
        if (entry.removed)
            continue;
        auto overrider = m_overrides.find(entry.identifier);
        if (overrider == m_overrides.end())
            continue;
        Entry& replacing = m_entries[overrider->second];
        entry.form.set("overrider", Value::string(replacing.uuid));
        replacing.form.set("overriding", Value::string(entry.identifier));
        OMLog::ops().info("plug-in %{public}@ overrides %{public}@", replacing.uuid, entry.uuid);
    }
    ArrayBuilder matches;
    for (auto& entry : m_entries) {
        if (!entry.removed)
            matches.append(entry.form.build());
    }
    return matches.build();
}

} // namespace om

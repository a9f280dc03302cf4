#include "platform/TypeConformance.h"

#include <algorithm>
#include <deque>
#include <functional>

#include "platform/Storage.h"

namespace om {

namespace {

constexpr std::string_view kOctetStream = "application/octet-stream";
constexpr std::string_view kTextPlain = "text/plain";

// The type in lower case, or empty when text is no well-formed type.
std::string normalized(std::string_view text)
{
    if (text.empty() || text.size() > TypeConformance::kMaxTypeLength)
        return {};
    const size_t slash = text.find('/');
    if (slash == 0 || slash == std::string_view::npos || slash + 1 == text.size()
        || text.find('/', slash + 1) != std::string_view::npos)
        return {};
    std::string out;
    out.reserve(text.size());
    for (const char c : text) {
        if (c <= ' ' || c > '~')
            return {};
        out.push_back(c >= 'A' && c <= 'Z' ? char(c - 'A' + 'a') : c);
    }
    return out;
}

bool isText(std::string_view canonicalType)
{
    return canonicalType.starts_with("text/");
}

// Calls pair(first, second) for every line that is exactly two space-separated words. A file that
// cannot be read, or is larger than any real database, contributes nothing.
void forEachPair(const std::string& path, const std::function<void(std::string_view, std::string_view)>& pair)
{
    auto bytes = Storage::readFile(path, TypeConformance::kMaxFileSize);
    if (!bytes.ok())
        return;
    std::string_view rest(reinterpret_cast<const char*>(bytes->data()), bytes->size());
    while (!rest.empty()) {
        const size_t newline = std::min(rest.find('\n'), rest.size());
        const std::string_view line = rest.substr(0, newline);
        rest.remove_prefix(std::min(newline + 1, rest.size()));
        const size_t space = line.find(' ');
        if (space != std::string_view::npos)
            pair(line.substr(0, space), line.substr(space + 1));
    }
}

} // namespace

const TypeConformance& TypeConformance::shared()
{
    // Built on first use and never torn down: lookups may run on threads that outlive main().
    static const TypeConformance* database = [] {
        std::vector<std::string> directories { Storage::dataHome() };
        const std::string dirs = Storage::environment("XDG_DATA_DIRS").value_or("/usr/local/share:/usr/share");
        for (size_t start = 0; start <= dirs.size();) {
            const size_t colon = std::min(dirs.find(':', start), dirs.size());
            if (colon > start)
                directories.push_back(dirs.substr(start, colon - start));
            start = colon + 1;
        }
        return new TypeConformance(fromDirectories(directories));
    }();
    return *database;
}

TypeConformance TypeConformance::fromDirectories(const std::vector<std::string>& dataDirectories)
{
    TypeConformance database;
    for (const auto& directory : dataDirectories)
        database.readAliases(directory + "/mime/aliases");
    for (const auto& directory : dataDirectories)
        database.readSubclasses(directory + "/mime/subclasses");
    return database;
}

void TypeConformance::readAliases(const std::string& path)
{
    forEachPair(path, [this](std::string_view alias, std::string_view target) {
        std::string from = normalized(alias);
        std::string to = normalized(target);
        // An earlier directory's alias stands; an alias of itself would only hide the type.
        if (!from.empty() && !to.empty() && from != to)
            m_aliases.emplace(std::move(from), std::move(to));
    });
}

// Aliases are all known by now, so both sides are stored canonical.
void TypeConformance::readSubclasses(const std::string& path)
{
    forEachPair(path, [this](std::string_view child, std::string_view parent) {
        std::string from = canonical(child);
        std::string to = canonical(parent);
        if (from.empty() || to.empty() || from == to)
            return;
        auto& parents = m_parents[std::move(from)];
        if (std::find(parents.begin(), parents.end(), to) == parents.end())
            parents.push_back(std::move(to));
    });
}

std::string TypeConformance::canonical(std::string_view type) const
{
    std::string lower = normalized(type);
    if (auto alias = m_aliases.find(lower); alias != m_aliases.end())
        return alias->second;
    return lower;
}

TypeConformance::Lineage TypeConformance::lineage(std::string_view type) const
{
    Lineage lineage;
    std::string start = canonical(type);
    if (start.empty())
        return lineage;
    // Breadth first; the visited set keeps a cycle in a damaged database from running forever.
    std::deque<const std::string*> pending;
    pending.push_back(&*lineage.types.insert(std::move(start)).first);
    while (!pending.empty()) {
        const std::string& current = *pending.front();
        pending.pop_front();
        lineage.isText = lineage.isText || isText(current);
        auto parents = m_parents.find(current);
        if (parents == m_parents.end())
            continue;
        for (const auto& parent : parents->second) {
            if (auto [inserted, added] = lineage.types.insert(parent); added)
                pending.push_back(&*inserted);
        }
    }
    return lineage;
}

bool TypeConformance::Lineage::conformsTo(const std::string& canonicalType) const
{
    if (types.empty() || canonicalType.empty())
        return false;
    if (canonicalType == kOctetStream || (canonicalType == kTextPlain && isText))
        return true;
    return types.contains(canonicalType);
}

bool TypeConformance::conforms(std::string_view type, std::string_view to) const
{
    return lineage(type).conformsTo(canonical(to));
}

} // namespace om

#include "platform/ActivationRule.h"

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <limits>
#include <map>
#include <string>
#include <vector>

namespace om {

namespace {

// Maximum flow by Dinic's algorithm over a network of at most a few thousand nodes and a million
// edges. The network here is source -> one node per distinct item type (capacity: how many items
// have it) -> one node per rule type it conforms to (unbounded) -> sink (capacity: what the rule
// type accepts). All items are placed exactly when the flow equals the number of items. Edges sit
// in one array, each node's as a linked list (forward star), so that building the densest network
// the bounds admit is one allocation.
class FlowNetwork {
public:
    FlowNetwork(size_t nodes, size_t edges)
        : m_first(nodes, kNone)
        , m_level(nodes)
        , m_current(nodes)
    {
        m_edges.reserve(2 * edges);
    }

    void addEdge(uint32_t from, uint32_t to, int32_t capacity)
    {
        m_edges.push_back({ to, m_first[from], capacity });
        m_first[from] = uint32_t(m_edges.size() - 1);
        m_edges.push_back({ from, m_first[to], 0 });
        m_first[to] = uint32_t(m_edges.size() - 1);
    }

    int32_t maximumFlow(uint32_t source, uint32_t sink)
    {
        int32_t total = 0;
        while (buildLevels(source, sink)) {
            m_current = m_first;
            while (const int32_t pushed = push(source, sink, std::numeric_limits<int32_t>::max()))
                total += pushed;
        }
        return total;
    }

private:
    static constexpr uint32_t kNone = std::numeric_limits<uint32_t>::max();

    struct Edge {
        uint32_t to;
        uint32_t next; // the next edge leaving the same node
        int32_t capacity; // what is left; the reverse edge holds what has been sent
    };

    bool buildLevels(uint32_t source, uint32_t sink)
    {
        std::fill(m_level.begin(), m_level.end(), -1);
        std::vector<uint32_t> frontier { source };
        m_level[source] = 0;
        for (size_t i = 0; i < frontier.size(); ++i) {
            const uint32_t node = frontier[i];
            for (uint32_t edge = m_first[node]; edge != kNone; edge = m_edges[edge].next) {
                const Edge& e = m_edges[edge];
                if (e.capacity > 0 && m_level[e.to] < 0) {
                    m_level[e.to] = m_level[node] + 1;
                    frontier.push_back(e.to);
                }
            }
        }
        return m_level[sink] >= 0;
    }

    // Recursion depth is the sink's level, which the network's shape keeps small.
    int32_t push(uint32_t node, uint32_t sink, int32_t limit)
    {
        if (node == sink)
            return limit;
        for (uint32_t& edge = m_current[node]; edge != kNone; edge = m_edges[edge].next) {
            Edge& e = m_edges[edge];
            if (e.capacity <= 0 || m_level[e.to] != m_level[node] + 1)
                continue;
            if (const int32_t pushed = push(e.to, sink, std::min(limit, e.capacity))) {
                e.capacity -= pushed;
                m_edges[edge ^ 1].capacity += pushed;
                return pushed;
            }
        }
        return 0;
    }

    std::vector<Edge> m_edges; // an edge and its reverse are neighbours: i and i ^ 1
    std::vector<uint32_t> m_first; // each node's most recently added edge
    std::vector<int> m_level;
    std::vector<uint32_t> m_current; // each node's next edge to try in this phase
};

// How many items a rule value accepts, never more than the items there are.
int64_t acceptedCount(const Value& value, size_t items)
{
    const auto limit = int64_t(items);
    if (auto integer = value.asInt64())
        return std::clamp<int64_t>(*integer, 0, limit);
    if (value.asUInt64())
        return limit; // only values past INT64_MAX are left here
    if (!value.isReal())
        return 0;
    const double real = *value.asDouble();
    if (!(real >= 1)) // NaN too
        return 0;
    return real >= double(limit) ? limit : int64_t(std::trunc(real));
}

// Distinct item types (canonical) and how many items have each; empty when the description is
// malformed, too large, or names something that is no type.
std::map<std::string, int64_t> countItemTypes(const Value& items, const TypeConformance& types)
{
    std::map<std::string, int64_t> counts;
    const Value& list = items["types"];
    if (!list.isArray() || list.count() > ActivationRule::kMaxItems)
        return {};
    for (const Value& element : list.elements()) {
        const std::string* type = element.asString();
        std::string canonical = type ? types.canonical(*type) : std::string();
        if (canonical.empty())
            return {};
        ++counts[std::move(canonical)];
    }
    return counts;
}

} // namespace

bool ActivationRule::evaluate(const Value& rule, const Value& items)
{
    return evaluate(rule, items, TypeConformance::shared());
}

bool ActivationRule::evaluate(const Value& rule, const Value& items, const TypeConformance& types)
{
    if (!rule.isDictionary() || rule.count() > kMaxRuleTypes)
        return false;
    const std::map<std::string, int64_t> itemTypes = countItemTypes(items, types);
    if (itemTypes.empty())
        return false;
    const size_t itemCount = items["types"].count();

    // Rule types that accept nothing, or are no type, cannot take part; if the rest cannot hold
    // every item, no assignment can.
    std::vector<std::pair<std::string, int64_t>> ruleTypes; // canonical type, how many it takes
    int64_t room = 0;
    for (const auto& [type, value] : rule.entries()) {
        const int64_t accepted = acceptedCount(value, itemCount);
        std::string canonical = accepted ? types.canonical(type) : std::string();
        if (!canonical.empty()) {
            ruleTypes.emplace_back(std::move(canonical), accepted);
            room += accepted;
        }
    }
    if (room < int64_t(itemCount))
        return false;

    // Which rule types each distinct item type fits, before the network is sized for them.
    std::vector<std::vector<uint32_t>> fits;
    size_t edges = itemTypes.size() + ruleTypes.size();
    for (const auto& [type, count] : itemTypes) {
        const TypeConformance::Lineage lineage = types.lineage(type);
        auto& fitting = fits.emplace_back();
        for (size_t r = 0; r < ruleTypes.size(); ++r) {
            if (lineage.conformsTo(ruleTypes[r].first))
                fitting.push_back(uint32_t(r));
        }
        if (fitting.empty())
            return false;
        edges += fitting.size();
    }

    const uint32_t source = 0;
    const auto firstRuleNode = uint32_t(1 + itemTypes.size());
    const auto sink = uint32_t(firstRuleNode + ruleTypes.size());
    FlowNetwork network(sink + 1, edges);
    uint32_t itemNode = 1;
    for (const auto& [type, count] : itemTypes) {
        network.addEdge(source, itemNode, int32_t(count));
        for (const uint32_t r : fits[itemNode - 1])
            network.addEdge(itemNode, firstRuleNode + r, int32_t(count));
        ++itemNode;
    }
    for (size_t r = 0; r < ruleTypes.size(); ++r)
        network.addEdge(firstRuleNode + uint32_t(r), sink, int32_t(ruleTypes[r].second));
    return network.maximumFlow(source, sink) == int32_t(itemCount);
}

} // namespace om

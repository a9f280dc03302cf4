#include "platform/ValueTreeConversion.h"

#include "platform/ConduitFrame.h"

namespace om {

// Both directions are the same check: the transport carries Value itself, so a tree that can
// travel is shared as it is, and one that cannot is refused here rather than at the peer.
std::optional<Value> ValueTreeConversion::toConduit(const Value& tree)
{
    if (ConduitFrame::whyNotCarriable(tree))
        return std::nullopt;
    return tree;
}

std::optional<Value> ValueTreeConversion::fromConduit(const Value& message)
{
    return toConduit(message);
}

} // namespace om

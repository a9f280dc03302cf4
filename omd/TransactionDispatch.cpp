// The dispatch table: request names, compared byte for byte and case-sensitively, in this order.
#include <array>
#include <string_view>

#include "omd/Transaction.h"

namespace om {

void Transaction::runHandler(const std::string& name)
{
    struct Handler {
        std::string_view name;
        void (Transaction::*run)();
    };
    static constexpr std::array<Handler, 9> kHandlers { {
        { "add", &Transaction::addPlugIns },
        { "remove", &Transaction::removePlugIns },
        { "bulk", &Transaction::bulkPlugIns },
        { "match", &Transaction::matchPlugIns },
        { "ready", &Transaction::readyPlugIns },
        { "access", &Transaction::accessPlugIns },
        { "annotate", &Transaction::annotatePlugIns },
        { "bulk-annotate", &Transaction::bulkAnnotatePlugIns },
        { "lock", &Transaction::lockDownPlugIns },
    } };

    for (const auto& handler : kHandlers) {
        if (handler.name == name)
            return (this->*handler.run)();
    }
    fail(4, "unrecognized request");
}

} // namespace om

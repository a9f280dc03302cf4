// Programming errors ("internal-consistency failures") end here: the message is logged at error
// level and the process aborts. No input from outside the process may reach this.
#pragma once

#include <string_view>

namespace om {

[[noreturn]] void internalInconsistency(std::string_view message);

} // namespace om

#define OM_ASSERT(condition)                                                                                           \
    do {                                                                                                               \
        if (!(condition)) [[unlikely]]                                                                                 \
            ::om::internalInconsistency("assertion failed: " #condition);                                              \
    } while (0)

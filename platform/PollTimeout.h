// The timeout argument of poll/epoll_wait for a deadline: milliseconds to it, rounded up so that
// a wait never wakes just before the deadline and spins through zero timeouts; 0 once it is due.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdint>

namespace om {

inline int pollTimeoutUntil(std::chrono::steady_clock::time_point deadline)
{
    const auto left = deadline - std::chrono::steady_clock::now();
    if (left <= std::chrono::steady_clock::duration::zero())
        return 0;
    return int(std::min<int64_t>(std::chrono::ceil<std::chrono::milliseconds>(left).count(), INT32_MAX));
}

} // namespace om

// Process-wide resource settings a daemon makes once at start-up, before it serves anyone.
#pragma once

#include <cstdint>

#include "platform/Result.h"

namespace om {

class ProcessResources {
public:
    // Raises the soft RLIMIT_NOFILE to the hard limit (or to fs.nr_open when the hard limit is
    // unlimited). Every client costs the daemon two descriptors, its socket and its pidfd, so the
    // common soft limit of 1024 would run out at about 500 clients. The soft limit in force
    // afterwards, or the failing call.
    static Result<uint64_t> raiseDescriptorLimit();

    // Makes every allocation of kLargeAllocation bytes or more a mapping of its own, returned to
    // the system when freed. By default the allocator raises that threshold each time a large
    // block is freed, so that after one 16 MiB frame the next ones come from the heap, whose
    // freed space a process keeps: a burst of large frames or a slow client's output would stay
    // resident for the life of the daemon.
    static void returnLargeAllocationsPromptly();
    static constexpr uint64_t kLargeAllocation = 1u << 20;
};

} // namespace om

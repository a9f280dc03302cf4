#include "platform/ProcessResources.h"

#include <malloc.h>
#include <sys/resource.h>

#include <cerrno>
#include <fstream>

namespace om {

namespace {

// The most descriptors the kernel lets any process have; an unlimited hard limit means this.
rlim_t systemDescriptorCeiling()
{
    std::ifstream file("/proc/sys/fs/nr_open");
    rlim_t ceiling = 0;
    if (file >> ceiling && ceiling > 0)
        return ceiling;
    return 1u << 20; // the kernel's default
}

} // namespace

Result<uint64_t> ProcessResources::raiseDescriptorLimit()
{
    rlimit limit {};
    if (::getrlimit(RLIMIT_NOFILE, &limit) < 0)
        return OMError::fromErrno("getrlimit(RLIMIT_NOFILE)", errno);
    const rlim_t wanted = limit.rlim_max == RLIM_INFINITY ? systemDescriptorCeiling() : limit.rlim_max;
    if (limit.rlim_cur != RLIM_INFINITY && limit.rlim_cur >= wanted)
        return uint64_t(limit.rlim_cur);
    limit.rlim_cur = wanted;
    if (::setrlimit(RLIMIT_NOFILE, &limit) < 0)
        return OMError::fromErrno("setrlimit(RLIMIT_NOFILE)", errno);
    return uint64_t(wanted);
}

void ProcessResources::returnLargeAllocationsPromptly()
{
    // Setting the threshold also fixes it (and the trim threshold) for good. Allocators other than
    // glibc's, as under the sanitizers, ignore it.
    (void)::mallopt(M_MMAP_THRESHOLD, int(kLargeAllocation)); // NOLINT(concurrency-mt-unsafe): at start-up
}

} // namespace om

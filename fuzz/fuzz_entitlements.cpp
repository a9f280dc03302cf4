// Reads arbitrary bytes as an executable's entitlements section, through a memory file as the
// Registrar and code signing read real executables. Whatever is accepted is none or a dictionary.
#include <sys/mman.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>

#include "platform/CodeSigning.h"
#include "platform/UniqueFd.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    om::UniqueFd file(::memfd_create("entitlements", MFD_CLOEXEC));
    if (!file.valid())
        std::abort();
    size_t done = 0;
    while (done < size) {
        ssize_t written = ::write(file.get(), data + done, size - done);
        if (written <= 0)
            std::abort();
        done += size_t(written);
    }
    auto entitlements = om::CodeSigningTask::readEntitlements(file.get());
    if (entitlements.ok() && !entitlements->isNone() && !entitlements->isDictionary())
        std::abort();
    return 0;
}

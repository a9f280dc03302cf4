#include "platform/Fatal.h"

#include <cstdlib>

#include "platform/Log.h"

namespace om {

void internalInconsistency(std::string_view message)
{
    Log::defaultLog().write(LogLevel::Error, message);
    std::abort();
}

} // namespace om

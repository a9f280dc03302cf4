#include "omd/OMDUserPrefs.h"

namespace om {

OMDUserPrefs::OMDUserPrefs()
{
    // The name is a constant that can name a file; adding it cannot fail.
    (void)addSuiteNamed(kDomain);
}

Value OMDUserPrefs::exclusions()
{
    Value value = synchronizedValueForKey("exclusions");
    return value.isArray() ? value : Value();
}

} // namespace om

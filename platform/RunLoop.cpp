#include "platform/RunLoop.h"

#include <unistd.h>

namespace om {

void RunLoop::runForever()
{
    for (;;)
        ::pause(); // returns after each handled signal; park again
}

} // namespace om

// The executable of every sample app and plug-in: says which bundle it runs from and stays up until
// it is stopped, as an app or a plug-in instance would.
#include <signal.h>
#include <unistd.h>

#include <cstdio>

#include "Ombrel/OMBundle.h"

int main()
{
    auto bundle = om::OMBundle::initForMainBundle();
    auto identifier = bundle->bundleIdentifier();
    std::printf("%s running (pid %d)\n", identifier ? identifier->c_str() : "sample", static_cast<int>(::getpid()));
    std::fflush(stdout);
    for (;;)
        ::pause();
}

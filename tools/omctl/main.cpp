// omctl: the command-line front end of omd.
#include <cstdlib>
#include <iostream>
#include <string>
#include <vector>

#include "tools/omctl/OmctlCommand.h"

int main(int argc, char** argv)
{
    // omctl says itself what went wrong, once; the client library's own log lines would repeat
    // it on the terminal. Setting EVLOG_LEVEL brings them back.
    ::setenv("EVLOG_LEVEL", "off", 0); // NOLINT(concurrency-mt-unsafe): before any thread starts
    std::vector<std::string> arguments(argv + 1, argv + argc);
    return om::OmctlCommand::run(arguments, std::cin, std::cout, std::cerr);
}

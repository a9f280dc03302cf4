// omctl: the command-line front end of omd.
#include <iostream>
#include <string>
#include <vector>

#include "tools/omctl/OmctlCommand.h"

int main(int argc, char** argv)
{
    std::vector<std::string> arguments(argv + 1, argv + argc);
    return om::OmctlCommand::run(arguments, std::cin, std::cout, std::cerr);
}

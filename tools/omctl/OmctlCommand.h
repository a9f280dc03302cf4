// omctl's front: global options, the table of subcommands, help, and the hand-over to the
// subcommand that does the work.
#pragma once

#include <iosfwd>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "tools/omctl/OmctlContext.h"

namespace om {

class OmctlCommand {
public:
    using Handler = int (*)(OmctlContext& context, const std::vector<std::string>& arguments);

    struct Entry {
        std::string_view name;
        std::string_view summary; // one line for the command list
        const char* help; // the full text of "omctl <name> --help"
        Handler handler;
    };

    static std::span<const Entry> commands();
    // arguments excludes the program name. Answers the process's exit status.
    static int run(const std::vector<std::string>& arguments, std::istream& in, std::ostream& out, std::ostream& err);

private:
    static void printHelp(std::ostream& out);
};

} // namespace om

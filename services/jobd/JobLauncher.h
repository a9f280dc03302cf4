// JobLauncher: starts one job under bubblewrap. Everything the child needs (argument and
// environment vectors, the descriptors it keeps) is prepared before fork; the child only moves
// descriptors into place, asks to die with jobd and execs bwrap.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "platform/UniqueFd.h"

namespace om {

class JobLauncher {
public:
    struct Child {
        pid_t pid = -1;
        UniqueFd pidfd;
    };

    // The bwrap executable: JOBD_BWRAP, else the first "bwrap" on PATH, else /usr/bin/bwrap.
    static std::string bwrapPath();

    // Runs bwrap with arguments (without argv[0]) and exactly this environment; the child gets
    // instanceSocket as descriptor instanceFd, /dev/null as standard input and jobd's own
    // standard output and error.
    static Result<Child> spawn(const std::string& bwrap, const std::vector<std::string>& arguments,
        const std::map<std::string, std::string>& environment, const UniqueFd& instanceSocket, int instanceFd);
};

} // namespace om

// ChildProcess: runs the small programs tests need (scripts/entitle, peer programs) with the
// test's own environment.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace om::test {

class ChildProcess {
public:
    // arguments[0] is the program's path; -1 when it cannot be started.
    static pid_t spawn(const std::vector<std::string>& arguments);
    // The exit status of a child that exits; -1 when a signal ended it or it is no child of ours.
    static int exitStatusOf(pid_t pid);
    // spawn() and exitStatusOf() together.
    static int run(const std::vector<std::string>& arguments);
};

} // namespace om::test

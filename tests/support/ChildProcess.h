// ChildProcess: runs the small programs tests need (scripts/entitle, peer programs, omctl) with the
// test's own environment, or with settings of its own and its output collected.
#pragma once

#include <sys/types.h>

#include <string>
#include <utility>
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

    struct Outcome {
        int status = -1; // exit status; -1 when it did not exit normally
        std::string out;
        std::string err;
    };
    // Runs a program to its end with settings overriding the test's environment, feeding it input
    // on standard input and collecting what it writes.
    static Outcome capture(const std::vector<std::string>& arguments,
        const std::vector<std::pair<std::string, std::string>>& settings = {}, const std::string& input = {});
};

} // namespace om::test

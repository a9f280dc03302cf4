// ChildProcess: runs the small programs tests need (scripts/entitle, peer programs, omctl) with the
// test's own environment, or with settings of its own and its output collected.
#pragma once

#include <sys/types.h>

#include <optional>
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

    // A program left running, its standard output and error read line by line as it writes them.
    // Destroying it kills the program if it still runs.
    class Running {
    public:
        Running(const std::vector<std::string>& arguments,
            const std::vector<std::pair<std::string, std::string>>& settings = {});
        ~Running();
        Running(const Running&) = delete;
        Running& operator=(const Running&) = delete;

        enum class Stream : uint8_t { Out, Err };
        // The next whole line (without its newline); none when the stream closes or a generous
        // time passes first.
        std::optional<std::string> readLine(Stream stream);
        void signal(int number);
        // The exit status once it exits; -1 when a signal ended it or it did not end in time.
        int wait();

    private:
        pid_t m_pid = -1;
        int m_fds[2] = { -1, -1 }; // standard output, standard error
        std::string m_pending[2];
    };
};

} // namespace om::test

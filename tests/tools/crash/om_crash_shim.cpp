// Preloaded into a daemon under test (LD_PRELOAD), kills that process with SIGKILL at one chosen
// step of an atomic file replacement, so that a test can look at what a crash at exactly that
// moment leaves on disk.
//
//   OMTEST_CRASH_FILE  a path fragment: only files and directories whose path holds it count
//   OMTEST_CRASH_STEP  write-half       the first write to such a file writes half its bytes, then dies
//                      before-fsync     at the fsync of such a file, before it runs
//                      after-fsync      right after the fsync of such a file
//                      before-rename    at a rename onto such a path, before it runs
//                      after-rename     right after such a rename
//                      after-dir-fsync  right after the fsync of such a directory
//
// Without both settings every call passes straight through.
#include <dlfcn.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

const char* setting(const char* name)
{
    const char* value = std::getenv(name); // NOLINT(concurrency-mt-unsafe): nothing in the daemon sets these
    return value && *value ? value : nullptr;
}

bool armedFor(const char* step)
{
    const char* chosen = setting("OMTEST_CRASH_STEP");
    return chosen && setting("OMTEST_CRASH_FILE") && std::strcmp(chosen, step) == 0;
}

bool pathCounts(const char* path)
{
    const char* fragment = setting("OMTEST_CRASH_FILE");
    return fragment && path && std::strstr(path, fragment) != nullptr;
}

// Whether fd is a file (directory == false) or directory (directory == true) that counts.
bool descriptorCounts(int fd, bool directory)
{
    struct stat info { };
    if (::fstat(fd, &info) != 0 || S_ISDIR(info.st_mode) != directory || (!directory && !S_ISREG(info.st_mode)))
        return false;
    char link[64];
    std::snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
    char path[4096];
    const ssize_t length = ::readlink(link, path, sizeof path - 1);
    if (length <= 0)
        return false;
    path[length] = '\0';
    return pathCounts(path);
}

[[noreturn]] void die()
{
    ::kill(::getpid(), SIGKILL);
    std::abort(); // not reached: SIGKILL cannot be caught
}

template <typename Function> Function next(const char* name)
{
    return reinterpret_cast<Function>(::dlsym(RTLD_NEXT, name)); // NOLINT: the C interface of dlsym
}

} // namespace

extern "C" {

ssize_t write(int fd, const void* buffer, size_t count)
{
    static auto real = next<ssize_t (*)(int, const void*, size_t)>("write");
    if (count > 1 && armedFor("write-half") && descriptorCounts(fd, false)) {
        (void)real(fd, buffer, count / 2);
        die();
    }
    return real(fd, buffer, count);
}

int fsync(int fd)
{
    static auto real = next<int (*)(int)>("fsync");
    if (armedFor("before-fsync") && descriptorCounts(fd, false))
        die();
    const int result = real(fd);
    if ((armedFor("after-fsync") && descriptorCounts(fd, false))
        || (armedFor("after-dir-fsync") && descriptorCounts(fd, true)))
        die();
    return result;
}

int rename(const char* from, const char* to)
{
    static auto real = next<int (*)(const char*, const char*)>("rename");
    if (armedFor("before-rename") && pathCounts(to))
        die();
    const int result = real(from, to);
    if (armedFor("after-rename") && pathCounts(to))
        die();
    return result;
}

} // extern "C"

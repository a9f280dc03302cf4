// Where the platform keeps state, and how files are replaced safely.
//
// A system instance runs as root and keeps its state under /var/lib/omd and /etc/omd; any other
// user is a per-user instance ("multi-user mode") whose state lives in its XDG directories.
// Every location can be overridden from the environment, so that tests stay inside their own
// temporary directory.
#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.h"

namespace om {

class Storage {
public:
    // True when this process runs as a user other than root.
    static bool isMultiUser();
    // $HOME, else the password database's home directory, else "/".
    static std::string homeDirectory();
    // ${XDG_DATA_HOME:-~/.local/share}
    static std::string dataHome();
    // ${XDG_CONFIG_HOME:-~/.config}
    static std::string configHome();
    // The value of an environment variable when set and not empty.
    static std::optional<std::string> environment(const char* name);
    // The environment's setting of name, else systemDefault for root, else userDefault.
    static std::string location(const char* name, std::string_view systemDefault, const std::string& userDefault);

    // The per-user data container of identifier: <dataHome>/omd/containers/<identifier>.
    static std::string userDataContainer(std::string_view identifier);
    // Whether text can name one directory entry: not empty, not "." or "..", no '/' or NUL, and
    // at most 255 bytes.
    static bool isSafeComponent(std::string_view text);

    // The canonical form of an absolute path (symbolic links, "." and ".." resolved), which must
    // exist and fit in limit bytes with its terminating NUL.
    static Result<std::string> canonicalPath(std::string_view path, size_t limit = 1024);

    // mkdir -p, with mode for the directories it makes.
    static Result<void> makeDirectories(const std::string& path, unsigned mode = 0755);
    enum class Existing : uint8_t { Replace, Keep };
    // Replaces the file at path with bytes so that a crash at any moment leaves either the old or
    // the new contents: a temporary file in the same directory, fsync, rename, fsync of the
    // directory. The file gets mode (before umask) when it is made. With Existing::Keep a file
    // already at path stays as it is and the call fails with EEXIST, so that of several writers
    // racing to make one file, exactly one succeeds and nobody ever sees a partial one.
    static Result<void> writeFileAtomically(const std::string& path, std::span<const uint8_t> bytes,
        unsigned mode = 0644, Existing existing = Existing::Replace);
    // Reads a whole regular file of at most maxBytes, however it grows while being read; a FIFO or
    // device put in its place fails at once instead of blocking. status, when given, receives the
    // fstat() of what was opened, also when it then fails for being no regular file or too large.
    static Result<std::vector<uint8_t>> readFile(
        const std::string& path, size_t maxBytes, struct stat* status = nullptr);
};

} // namespace om

// Sandbox extensions: tokens that grant read-only access to one file or directory.
//
// A token is the text "<class>;<issue time>;<HMAC-SHA256 hex>;<canonical path>": the path last and
// unencoded, so that any path fits and a person can read what a token grants. The HMAC is taken
// over "<class>;<issue time>;<canonical path>" under a per-machine key, the 32 bytes of the
// SANDBOX_KEY file (made 0600 on first use; refused when it is not a regular file of exactly 32
// bytes owned by this user, or when group or others may read or write it). Consuming a
// token verifies it and opens its path read-only without following any symbolic link, so a token
// for one path never opens another; the handle is that descriptor. Releasing closes it.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Result.h"

namespace om {

class Sandbox {
public:
    // The one class of extension there is: read-only access to files.
    static constexpr std::string_view kReadOnlyFileClass = "com.orvex.sandbox.read-only";
    // Issue flag: canonicalise the path (resolve links, ".", "..") before it goes into the token.
    static constexpr uint32_t kCanonicalPath = 1;

    // A token for path. An error (POSIX domain, the errno as code) when the path cannot be
    // canonicalised or the key cannot be read or made.
    static Result<std::string> issueFileExtension(
        std::string_view extensionClass, std::string_view path, uint32_t flags);
    // The canonical path a genuine token grants; an error for a malformed, forged or tampered one.
    static Result<std::string> verify(std::string_view token);
    // A handle for a genuine token whose path could be opened; -1 otherwise. A handle is a
    // close-on-exec descriptor, never 0, 1 or 2. Each call opens anew.
    static int64_t consume(std::string_view token);
    // Closes what consume opened; does nothing for a value consume never answers (below 3).
    static void release(int64_t handle);
    // path with every symbolic link, "." and ".." resolved; an error (POSIX domain, the errno as
    // code) when some component does not exist or cannot be searched.
    static Result<std::string> canonicalPath(std::string_view path);

    // SANDBOX_KEY, else /var/lib/omd/sandbox.key for root and
    // ${XDG_DATA_HOME:-~/.local/share}/omd/sandbox.key for other users.
    static std::string keyPath();
};

} // namespace om

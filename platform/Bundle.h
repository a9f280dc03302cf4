// Bundle: the platform's handle on a bundle directory (an app or plug-in with Info.vlist at its
// root). A handle made for a path that holds no bundle still exists and answers nothing.
//
// Layout: the support files live in the bundle directory itself, and the main executable is the
// file that Info.vlist's VBBundleExecutable names, relative to the bundle directory. The bundle
// that contains an executable is the nearest ancestor directory whose Info.vlist names that file.
// Every path a handle answers is canonical (absolute, symbolic links resolved, no trailing slash).
//
// Handles are immutable apart from the Info.vlist cache and may be shared between threads.
#pragma once

#include <sys/types.h>

#include <ctime>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace om {

class Bundle {
public:
    // The bundle at a directory: a bundle when the directory has an Info.vlist.
    static std::shared_ptr<const Bundle> withPath(std::string_view path);
    // The nearest bundle whose main executable is the file at executablePath.
    static std::shared_ptr<const Bundle> containingExecutable(std::string_view executablePath);
    // The bundle that contains this program's executable.
    static std::shared_ptr<const Bundle> mainBundle();
    // A bundle whose support files are kept apart from its directory. The standard layout never
    // does this; it exists for layouts that do and for tests of code that must not confuse the two.
    static std::shared_ptr<const Bundle> withDirectories(
        std::string_view bundlePath, std::string_view supportFilesPath);

    std::optional<std::string> bundlePath() const { return m_bundlePath; }
    // <bundle>/<VBBundleExecutable>; absent when the key is missing or names a file outside the
    // bundle (an absolute path or one that climbs out with "..").
    std::optional<std::string> executablePath() const;
    std::optional<std::string> supportFilesPath() const { return m_supportFilesPath; }

    // The parsed Info.vlist: a dictionary, or none when the file is missing, does not parse or is
    // not a dictionary.
    Value infoDictionary() const;

    std::string description() const;

private:
    Bundle(
        std::string requestedPath, std::optional<std::string> bundlePath, std::optional<std::string> supportFilesPath);

    static std::shared_ptr<const Bundle> withCanonicalDirectory(
        std::string requestedPath, const std::string& directory);

    // What identifies one version of Info.vlist on disk. Comparing it costs one stat(2), so a
    // handle re-parses the file only when it was replaced or rewritten.
    struct FileStamp {
        dev_t device = 0;
        ino_t inode = 0;
        off_t size = 0;
        timespec modified {};
        timespec changed {};
        bool operator==(const FileStamp& other) const;
    };
    static std::optional<FileStamp> stampOf(const std::string& path);

    std::string m_requestedPath; // what the handle was asked for; only for description()
    std::optional<std::string> m_bundlePath;
    std::optional<std::string> m_supportFilesPath;

    mutable std::mutex m_infoMutex;
    mutable std::optional<FileStamp> m_infoStamp; // the file version m_info was read from
    mutable Value m_info;
};

} // namespace om

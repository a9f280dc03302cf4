// Preferences: the current user's settings, read from preference domains.
//
// A domain is the vlist file <domain>.vlist, a dictionary, under the preferences directory
// (PREFS_DIR; default ${XDG_CONFIG_HOME:-~/.config}/omd/prefs, /etc/omd/prefs for root). A
// Preferences object searches its domains in the order they were added. It keeps what it read and
// goes back to a file only when the file's identity (device, inode) or state (size, modification
// and change times) differs from what it read last, so synchronising is a stat() per domain.
//
// A missing file is an empty domain. A damaged one (unreadable, not a regular file, larger than
// kMaxFileSize, not a vlist, not a dictionary) is empty too, and is logged once at error level per
// version of the file, however often it is read. All operations are thread-safe.
#pragma once

#include <sys/stat.h>

#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class Preferences {
public:
    static constexpr size_t kMaxFileSize = 1024 * 1024;

    // The directory PREFS_DIR names, else the default for this user.
    static std::string defaultDirectory();

    // Domains under defaultDirectory(), as it is when the object is made.
    Preferences();
    explicit Preferences(std::string directory);
    virtual ~Preferences();
    Preferences(const Preferences&) = delete;
    Preferences& operator=(const Preferences&) = delete;

    const std::string& directory() const { return m_directory; }
    // The path of a domain's file, or none when the name cannot name a file of its own.
    std::optional<std::string> pathOfDomain(std::string_view domain) const;

    // Appends domain to the search list (again: no change). Fails for a name that cannot be a file
    // name. The domain is read at the next synchronize().
    Result<void> addSuiteNamed(std::string_view domain);
    // Brings every domain of the search list up to date with its file.
    void synchronize();
    // The value of key in the first domain of the search list that has it; none when none has.
    Value valueForKey(std::string_view key) const;
    // synchronize(), then valueForKey(key).
    Value synchronizedValueForKey(std::string_view key);

    // For tools and tests (the daemon only reads): sets key in domain's file to value, or removes
    // it when value is none, rewriting the whole file atomically in the XML form. The domain need
    // not be in the search list. A damaged file is left alone and the write fails.
    Result<void> setValue(std::string_view domain, std::string_view key, const Value& value);

private:
    // What a file was when it was last read: its identity and state, or the errno of the stat()
    // that failed (ENOENT for a missing file).
    struct Version {
        dev_t device = 0;
        ino_t inode = 0;
        off_t size = 0;
        int64_t modified = 0; // nanoseconds
        int64_t changed = 0; // nanoseconds
        int error = 0;
        bool operator==(const Version&) const = default;
    };
    struct Domain {
        std::string name;
        std::string path;
        std::optional<Version> version; // none until first read
        Value contents; // a dictionary, possibly empty
    };

    static Version versionOf(const struct stat& info);
    static Version versionOf(const std::string& path);
    // Reads and parses a domain's file: its version, and its contents or why they are unusable.
    static std::pair<Version, Result<Value>> load(const std::string& path);
    void refresh(Domain& domain);

    const std::string m_directory;
    mutable std::mutex m_mutex;
    std::vector<Domain> m_domains;
};

} // namespace om

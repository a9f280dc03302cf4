// SandboxProfile: one named sandbox, read from <profiles directory>/<name>.vlist, and the
// bubblewrap command line that runs a job under it.
//
// A profile file is a dictionary:
//   "Unshare"      array of namespaces to unshare besides the network: "user", "pid", "ipc", "uts",
//                  "cgroup"
//   "Network"      boolean; false (the default) unshares the network namespace as well
//   "SystemPaths"  array of absolute paths bound read-only when they exist (what a dynamically
//                  linked program needs: /usr, /etc/ld.so.cache, ...)
//   "Symlinks"     dictionary of absolute link path to target (the merged-/usr links: /lib -> usr/lib)
//   "Proc", "Dev"  booleans: mount a fresh /proc, a minimal /dev (default true)
// Every job also gets a private /tmp, its bundle read-only, its data container as the writable
// home, the paths its sandbox extensions name read-only, jobd's socket (for process assertions),
// --die-with-parent, --new-session, every capability dropped and no new privileges.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "services/jobd/JobSpec.h"

namespace om {

class SandboxProfile {
public:
    // JOBD_PROFILES_DIR, else the installed profiles directory.
    static std::string directory();
    // The profile <directory>/<name>.vlist; an error when it is missing or malformed.
    static Result<std::shared_ptr<const SandboxProfile>> load(const std::string& directory, const std::string& name);

    const std::string& name() const { return m_name; }
    bool network() const { return m_network; }

    // bwrap's arguments (without argv[0]) to run job's executable; jobdSocket is bound so that the
    // job can reach jobd.
    std::vector<std::string> arguments(const JobSpec& job, const std::string& jobdSocket) const;

private:
    SandboxProfile() = default;

    std::string m_name;
    std::vector<std::string> m_unshare;
    bool m_network = false;
    bool m_proc = true;
    bool m_dev = true;
    std::vector<std::string> m_systemPaths;
    std::map<std::string, std::string> m_symlinks;
};

} // namespace om

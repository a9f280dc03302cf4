// One application as the Registrar knows it: an ".app" directory that contains registered plug-ins.
// Immutable once made; shared by every plug-in record of the application.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/Value.h"

namespace om {

class Bundle;

class RegistrarAppRecord {
public:
    struct Facts {
        std::string path; // canonical bundle directory
        std::optional<std::string> bundleIdentifier; // VBBundleIdentifier
        std::optional<std::string> displayName;
    };

    explicit RegistrarAppRecord(Facts facts);
    ~RegistrarAppRecord();

    const std::string& path() const { return m_facts.path; }
    const std::optional<std::string>& bundleIdentifier() const { return m_facts.bundleIdentifier; }
    const std::optional<std::string>& displayName() const { return m_facts.displayName; }

    // Whether the application is not completely installed: its Info.vlist cannot be read, or its
    // VBBundleExecutable is absent or names a missing file. Asked of the disk at every call, since
    // an installer may be replacing the application at this very moment.
    bool isPlaceholder() const;

    // "<RegistrarAppRecord identifier path>", for log lines.
    std::string description() const;

private:
    std::shared_ptr<const Bundle> bundle() const;

    const Facts m_facts;
    // The handle caches Info.vlist by file stamp, so a placeholder check costs a few stat calls.
    mutable std::mutex m_bundleMutex;
    mutable std::shared_ptr<const Bundle> m_bundle;
};

} // namespace om

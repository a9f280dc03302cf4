// JobSpec: what jobd needs to launch one executable, read from the activation overlay that the
// manager (omd) hands over with a grant, and checked once, when the grant is recorded.
//
// Overlay: {"ConduitService": {"EnvironmentVariables": {text: text}, "_SandboxProfile": text,
// "_SandboxExtensions": [tokens], ...}, "VBBundlePackageType": "CND!"}. Other keys of the service
// description are accepted and ignored. The bundle is the one that contains the executable; its
// Info.vlist gives the bundle identifier and version ("1" when it has none). "HOME" in the
// environment names the data container.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

struct JobSpec {
    // Bounds of one overlay.
    static constexpr size_t kMaxEnvironmentEntries = 256;
    static constexpr size_t kMaxEnvironmentBytes = 64 * 1024;
    static constexpr size_t kMaxExtensions = 32;

    std::string executablePath;
    std::string bundlePath;
    std::string bundleIdentifier;
    std::string version;
    std::string profile;
    std::map<std::string, std::string> environment;
    std::optional<std::string> home; // the data container, when the environment names one
    std::vector<std::string> readablePaths; // what the overlay's sandbox extensions grant

    // An error with the reason when the overlay or the executable is unusable.
    static Result<JobSpec> fromOverlay(const std::string& executablePath, const Value& overlay);
};

} // namespace om

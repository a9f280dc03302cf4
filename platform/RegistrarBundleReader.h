// How the Registrar reads a bundle: what it declares (Info.vlist), what its executable is entitled to,
// and which application contains it.
//
// The heart is plugInFacts(), a pure function from a bundle's canonical path, its Info value, its
// entitlements and the SDK entries to the facts of a plug-in record, or to the reason the bundle is
// no plug-in. The workspace runs it at registration and again at every open (the SDK may have
// changed in between); the fuzzer runs it on bytes that never touched a disk.
#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/Log.h"
#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class RegistrarBundleReader {
public:
    // An Info.vlist past either bound counts as unreadable: no real bundle comes near them, and a
    // hostile one must not make the daemon hold or walk more.
    static constexpr size_t kMaxInfoBytes = size_t(1) << 20;
    static constexpr unsigned kMaxInfoDepth = 32; // containers, the top dictionary included
    // A longer path is refused before it reaches the file system.
    static constexpr size_t kMaxPathBytes = 1024;

    // The SDK entry of an extension point (a dictionary), or none.
    using SdkLookup = std::function<Value(std::string_view extensionPoint)>;

    struct PlugInFacts {
        std::string identifier;
        std::string originalIdentifier;
        std::optional<std::string> bundleIdentifier;
        std::optional<std::string> bundleVersion;
        Value infoDictionary; // canonical
        Value plugInDictionary; // canonical
        Value entitlements;
        std::string displayName;
        std::string shortDisplayName;
        bool isDataPlugIn = false; // "QSExtensionProtocol" is "#Data": it gets no data container
        bool onSystemPartition = false;
    };

    struct AppFacts {
        std::optional<std::string> bundleIdentifier;
        std::string displayName;
    };

    // Info.vlist bytes, in either form, as a dictionary within the bounds above.
    static Result<Value> parseInfo(std::span<const uint8_t> bytes);
    // The facts of the plug-in bundle at canonicalPath, or why it is refused.
    static Result<PlugInFacts> plugInFacts(
        const std::string& canonicalPath, const Value& info, const Value& entitlements, const SdkLookup& sdk);
    // An application's facts; its Info value may be none (then it is named after its directory).
    static AppFacts appFacts(const std::string& canonicalPath, const Value& info);

    // The canonical path of a bundle a caller names: absolute, within kMaxPathBytes, resolved.
    static Result<std::string> canonicalPath(std::string_view path);
    // <bundlePath>/Info.vlist through parseInfo().
    static Result<Value> readInfo(const std::string& bundlePath);
    // The entitlements of the executable that info names inside the bundle: none when it has none,
    // is missing, may not grant any (owner, mode) or has a damaged section; the last three are
    // logged.
    static Value readEntitlements(const std::string& bundlePath, const Log& log);
    // The nearest ancestor directory of canonicalPath whose name ends in ".app" and that holds an
    // Info.vlist.
    static std::optional<std::string> containingApplication(const std::string& canonicalPath);
};

} // namespace om

// OMBundle: a small read-only view of a bundle on disk (an app or a plug-in), answering where it
// is, where its executable and its PlugIns directory are, and what its Info.vlist says.
//
// A reader always exists: one made for a path that names no bundle answers every question with
// nothing. URLs here are "file://" strings (see fileURL), the only kind a bundle can have.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Bundle.h"
#include "platform/Value.h"

namespace om {

class OMBundle {
public:
    static std::shared_ptr<OMBundle> initForMainBundle();
    // The bundle directory at path.
    static std::shared_ptr<OMBundle> initWithPath(std::string_view path);
    static std::shared_ptr<OMBundle> initWithURL(std::string_view url);
    // The bundle whose main executable is at path; when there is none, path read as a bundle
    // directory.
    static std::shared_ptr<OMBundle> initWithExecutablePath(std::string_view path);
    static std::shared_ptr<OMBundle> initWithExecutableURL(std::string_view url);
    // Every other factory ends here. A null handle is read as a bundle that answers nothing.
    static std::shared_ptr<OMBundle> initWithConduitBundle(std::shared_ptr<const Bundle> bundle);

    enum class Property : uint8_t { BundlePath, ExecutablePath, SupportFilesPath };
    std::optional<std::string> stringProperty(Property which) const;

    std::optional<std::string> path() const;
    std::optional<std::string> url() const;
    // The main executable; the bundle path for a bundle that names none.
    std::optional<std::string> executablePath() const;
    // The support-files directory, read from the handle once and then kept.
    std::optional<std::string> supportPath() const;
    // supportPath with name appended as one more path component.
    std::optional<std::string> bundleDirectory(std::string_view name) const;
    std::optional<std::string> plugInsPath() const;
    // Info.vlist as a value tree; none (and a log line) when it cannot be read or carried.
    // Read again at every call.
    Value infoDictionary() const;
    std::optional<std::string> bundleIdentifier() const;

    const std::shared_ptr<const Bundle>& conduitBundle() const { return _bundle; }

    // "file://" followed by the absolute path, each byte outside the RFC 3986 path characters
    // written as %XX.
    static std::string fileURL(std::string_view path);
    // The absolute path of a "file://" URL with an empty or "localhost" authority; none for any
    // other URL or for a malformed or NUL escape. A query or fragment is not part of the path.
    static std::optional<std::string> pathOfFileURL(std::string_view url);

private:
    explicit OMBundle(std::shared_ptr<const Bundle> bundle);

    std::shared_ptr<const Bundle> _bundle;
    // Two first calls on different threads may both read the property; the lock only keeps the
    // store itself from racing, and both read the same value.
    mutable std::mutex m_supportPathMutex;
    mutable std::optional<std::string> m_supportPath;
};

} // namespace om

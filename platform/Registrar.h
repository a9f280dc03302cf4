// The Registrar: the registry of installed applications and plug-ins, embedded in the daemon.
//
// Registrations persist in SQLite (WAL) at REGISTRAR_DB and are held in memory as shared immutable
// records, indexed by UUID, bundle path, containing application, identifier and extension point.
// Registering a plug-in bundle reads its Info.vlist (either vlist form) and its executable's
// ".entitlements" section (counted only from a file owned by root or by us and writable by nobody
// else), merges the SDK entry of its extension point (REGISTRAR_SDK_DIR/<id>.vlist), records the
// containing application (the nearest ancestor ".app" directory with an Info.vlist) and creates the
// data container of a plug-in that is not a data plug-in under REGISTRAR_CONTAINERS. A write is
// acknowledged only once it is committed to disk.
//
// Registration is refused for a bundle that is no plug-in: no readable Info.vlist, neither a
// "QSExtension" dictionary nor an "Ombrel" key, or no identifier. Anything else registers; what is
// visible is the daemon's decision. Registering a registered path again refreshes it and keeps its
// UUID while its identifier is unchanged.
//
// Observers hear of installs and uninstalls through the Registrar's own notification queue, one
// notification at a time, in the order the changes were made. Installs are delivered on its thread
// after the commit. An uninstall is delivered synchronously, on the thread that removes the
// registration while it holds that queue, and every observer has returned before the registration
// is removed; an observer may itself register or unregister from a notification. A refresh that
// changes a registration is announced as the uninstall of the old record followed by the install
// of the new one.
//
// Every lookup may be made from any thread; none waits for a registration in progress beyond the
// moment its new records are published.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/RegistrarAppRecord.h"
#include "platform/RegistrarPlugInRecord.h"
#include "platform/Result.h"
#include "platform/Uuid.h"
#include "platform/Value.h"

namespace om {

inline constexpr const char* kRegistrarErrorDomain = "Registrar";
enum RegistrarErrorCode : int64_t {
    kRegistrarErrorRefused = 1, // the bundle is no plug-in, or its path cannot name one
    kRegistrarErrorNotRegistered = 2, // nothing is registered at the path
    kRegistrarErrorDatabase = 3, // the database cannot be opened, read or written
    kRegistrarErrorReadOnly = 4, // the workspace was opened for reading only
};

class RegistrarObserver {
public:
    virtual ~RegistrarObserver() = default;
    virtual void pluginsDidInstall(const RegistrarPlugInRecords& records) = 0;
    // The records are still registered while this runs.
    virtual void pluginsWillUninstall(const RegistrarPlugInRecords& records) = 0;
};

class RegistrarWorkspace : public std::enable_shared_from_this<RegistrarWorkspace> {
public:
    struct Configuration {
        std::string databasePath; // REGISTRAR_DB
        std::string sdkDirectory; // REGISTRAR_SDK_DIR
        std::string containersDirectory; // REGISTRAR_CONTAINERS

        // The environment's settings, with the defaults of a system instance (root) or of a
        // per-user one.
        static Configuration fromEnvironment();
    };
    enum class Access : uint8_t { ReadWrite, ReadOnly };

    // Opens (creating when absent, for ReadWrite) the database and loads every registration. A
    // database that is damaged or of a newer schema is an error naming the file; it is never
    // discarded or rewritten.
    static Result<std::shared_ptr<RegistrarWorkspace>> open(const Configuration& configuration, Access access);
    // The process's workspace: opened from the environment on first use, then kept.
    static Result<std::shared_ptr<RegistrarWorkspace>> defaultWorkspace();
    // Makes workspace the process's workspace (programs that open their own, and tests).
    static void setDefaultWorkspace(std::shared_ptr<RegistrarWorkspace> workspace);

    ~RegistrarWorkspace();
    RegistrarWorkspace(const RegistrarWorkspace&) = delete;
    RegistrarWorkspace& operator=(const RegistrarWorkspace&) = delete;

    const Configuration& configuration() const;

    // Lookups. Paths are compared as given after trailing slashes are removed; registered paths
    // are canonical.
    std::shared_ptr<const RegistrarPlugInRecord> plugInWithUuid(const Uuid& uuid) const;
    std::shared_ptr<const RegistrarPlugInRecord> plugInAtPath(std::string_view bundlePath) const;
    std::shared_ptr<const RegistrarAppRecord> applicationAtPath(std::string_view bundlePath) const;
    // The application's plug-ins in bundle-path order; empty for an unknown application.
    RegistrarPlugInRecords plugInsOfApplication(std::string_view applicationPath) const;
    // Every registered plug-in, in registration order.
    RegistrarPlugInRecords allPlugIns() const;
    // Every application that contains a registered plug-in, in path order.
    std::vector<std::shared_ptr<const RegistrarAppRecord>> allApplications() const;
    size_t plugInCount() const;

    // Called for each candidate of a query with its identifier and entitlements dictionary (none
    // when it has none); true keeps the candidate.
    using CandidateFilter = std::function<bool(const std::string& identifier, const Value& entitlements)>;
    // The registered plug-ins a host's rules dictionary may select, in registration order, each
    // passed through filter (when given). The rules on "QSExtensionPointIdentifier" and
    // "QSExtensionIdentifier" narrow the candidates through their indexes when every pattern is a
    // plain text or "=" text (one or an array); the query never drops a plug-in that those rules
    // would keep under the version comparison, and leaves every other key to the caller's matcher.
    RegistrarPlugInRecords query(const Value& rules, const CandidateFilter& filter) const;

    // The SDK entry of an extension point: the dictionary in <sdkDirectory>/<identifier>.vlist,
    // or none. Read once and kept until dropCaches().
    Value sdkEntry(std::string_view extensionPointIdentifier) const;
    // Drops what the workspace keeps that can be read again (SDK entries).
    void dropCaches();

    // Registers the plug-in bundle at bundlePath (canonicalised here). The error says why the
    // bundle is refused.
    Result<std::shared_ptr<const RegistrarPlugInRecord>> registerPlugIn(std::string_view bundlePath);
    // For installers and tools that register many bundles at once: each path is checked as by
    // registerPlugIn(), and everything accepted is committed together, with one wait for the disk.
    // One result per path, in order; a refused bundle does not keep the others out.
    std::vector<Result<std::shared_ptr<const RegistrarPlugInRecord>>> registerPlugIns(
        const std::vector<std::string>& bundlePaths);
    // Unregisters the plug-in registered at bundlePath; an error when none is. The bundle need not
    // exist on disk any more.
    Result<void> unregisterPlugIn(std::string_view bundlePath);

    // Observers are held weakly and told of every later change.
    void addObserver(std::weak_ptr<RegistrarObserver> observer);
    // Returns once every notification queued before the call has been delivered.
    void waitForNotifications() const;

private:
    struct State;
    explicit RegistrarWorkspace(std::unique_ptr<State> state);
    std::unique_ptr<State> m_state;
};

} // namespace om

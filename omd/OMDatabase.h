// The daemon's view of the installed plug-ins. The Registrar owns the list; the database turns its
// records into daemon records (OMDPlugIn), caches them by UUID, answers lookups by UUID, path and
// containing application, passes registrations on, and hears the Registrar's install and
// uninstall notifications. The server is a subclass; this is its frame and cache.
//
// _sync is the database's one lock: every read and change of the cache runs on it. Nothing that
// runs there may enter it synchronously again.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "omd/OMDatabaseDelegate.h"
#include "platform/OMError.h"
#include "platform/Registrar.h"
#include "platform/Result.h"
#include "platform/Uuid.h"
#include "platform/WorkQueue.h"

namespace om {

class OMDAnnotationStore;
class OMDPlugIn;
using OMDPlugIns = std::vector<std::shared_ptr<OMDPlugIn>>;

// Posted when annotations or holds change, so that hosts run discovery again.
inline constexpr const char* kAnnotationChangeNotification = "com.orvex.ombrel.annotation-change";

class OMDatabase : public std::enable_shared_from_this<OMDatabase>, public RegistrarObserver {
public:
    // databasePath is the "-d" file of the annotation store, or none for its default location.
    // None when the Registrar cannot be opened.
    static std::shared_ptr<OMDatabase> initWithDatabase(std::optional<std::string> databasePath);
    ~OMDatabase() override;

    OMDatabase(const OMDatabase&) = delete;
    OMDatabase& operator=(const OMDatabase&) = delete;

    // Set by the server before it serves, never changed afterwards.
    std::shared_ptr<OMDatabaseDelegate> delegate() const { return m_delegate.lock(); }
    void setDelegate(std::weak_ptr<OMDatabaseDelegate> delegate) { m_delegate = std::move(delegate); }
    uint32_t cacheLimit() const { return m_cacheLimit; }
    void setCacheLimit(uint32_t limit) { m_cacheLimit = limit; }
    const std::shared_ptr<RegistrarWorkspace>& workspace() const { return m_workspace; }
    const std::shared_ptr<OMDAnnotationStore>& annotations() const { return m_annotations; }

    const std::optional<std::string>& databasePath() const { return m_databasePath; }
    // Number of cached records; enters _sync, so never call it from there.
    size_t cachedRecordCount() const;

    // The cached record of a Registrar record, made on a miss. Enters _sync.
    std::shared_ptr<OMDPlugIn> plugInForProxy(const std::shared_ptr<const RegistrarPlugInRecord>& proxy);
    // Builds, auto-elects and caches a record; the caller must already run on _sync.
    std::shared_ptr<OMDPlugIn> createPlugInForProxy(const std::shared_ptr<const RegistrarPlugInRecord>& proxy);
    // Empties the cache (all of it) once it holds more than limit records. On _sync.
    void purgeCachesToLimit(uint32_t limit);
    // The cache, then the Registrar. Enters _sync.
    std::shared_ptr<OMDPlugIn> findPlugIn(const Uuid& uuid);
    // Always asks the Registrar by path first; url is a file URL.
    std::shared_ptr<OMDPlugIn> findPlugInAtPath(std::string_view url);
    // The records of an application's plug-ins in the Registrar's order; none when the
    // application is unknown or has no plug-ins.
    std::optional<OMDPlugIns> plugInsWithinApplication(std::string_view url);
    // Registration through the Registrar; the cache follows its notifications.
    std::optional<OMError> addPlugIn(std::string_view url);
    std::optional<OMError> removePlugIn(std::string_view url);

    // The discovery query's candidates for a host's rules (OMDatabaseDiscovery.cpp): the
    // Registrar's records, narrowed by its indexes and by the election prefilter, as cached
    // records. None when the Registrar returned nothing.
    std::optional<OMDPlugIns> findPlugIns(const Value& rules);
    // The election texts a rules dictionary's "QSUserElection" pushes into the Registrar's query;
    // none when it cannot be pushed down.
    static std::optional<std::vector<std::string>> electionPrefilter(const Value& rules);

    // The annotation entry points (OMDatabaseAnnotations.cpp); they enter _sync.
    Value annotationForPlugIn(const OMDPlugIn& plugIn) const;
    void setAnnotation(const Value& annotation, const OMDPlugIn& plugIn);
    void notifyAnnotationChange();

    // The Registrar's notifications, on its notification thread.
    void pluginsDidInstall(const RegistrarPlugInRecords& records) override;
    void pluginsWillUninstall(const RegistrarPlugInRecords& records) override;
    // Elects a plug-in that carries the auto-elect entitlement, unless the user already chose.
    // On _sync.
    void autoElect(const std::shared_ptr<OMDPlugIn>& plugIn);

protected:
    explicit OMDatabase(std::optional<std::string> databasePath);
    // The fallible half of construction, run once the object is owned by a shared_ptr (observer
    // registration needs a weak reference to it): opens the Registrar and the annotation store,
    // and observes the Registrar.
    Result<void> openDatabase();
    // Stores a record in the cache; on _sync.
    void cache(const std::shared_ptr<OMDPlugIn>& plugIn);

    // Read and changed only on _sync.
    std::unordered_map<Uuid, std::shared_ptr<OMDPlugIn>> m_cache;
    const std::shared_ptr<WorkQueue> _sync;

private:
    bool passesPrefilter(
        const std::vector<std::string>& prefilter, const std::string& identifier, const Value& entitlements) const;
    static Value describe(const RegistrarPlugInRecords& records);

    std::weak_ptr<OMDatabaseDelegate> m_delegate;
    uint32_t m_cacheLimit = 0;
    std::shared_ptr<RegistrarWorkspace> m_workspace;
    std::shared_ptr<OMDAnnotationStore> m_annotations;
    // The cache's size for log lines written off _sync.
    std::atomic<size_t> m_cachedCount { 0 };
    const std::optional<std::string> m_databasePath;
};

} // namespace om

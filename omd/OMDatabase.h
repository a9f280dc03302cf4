// The daemon's view of the installed plug-ins: the record cache, and (as they arrive) the
// annotation store and the Registrar's notifications. The server is a subclass; this is its frame.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>

#include "omd/OMDatabaseDelegate.h"
#include "platform/Result.h"
#include "platform/Uuid.h"
#include "platform/WorkQueue.h"

namespace om {

// The record class is not in the tree yet: it arrives, and this declaration gives way to its
// header, together with the lookups that fill the cache. Nothing in the frame looks inside one.
class OMDPlugIn;

class OMDatabase : public std::enable_shared_from_this<OMDatabase> {
public:
    // databasePath is the "-d" file of the annotation store, or none for its default location.
    static std::shared_ptr<OMDatabase> initWithDatabase(std::optional<std::string> databasePath);
    virtual ~OMDatabase();

    OMDatabase(const OMDatabase&) = delete;
    OMDatabase& operator=(const OMDatabase&) = delete;

    // Set by the server before it serves, never changed afterwards.
    std::shared_ptr<OMDatabaseDelegate> delegate() const { return m_delegate.lock(); }
    void setDelegate(std::weak_ptr<OMDatabaseDelegate> delegate) { m_delegate = std::move(delegate); }
    uint32_t cacheLimit() const { return m_cacheLimit; }
    void setCacheLimit(uint32_t limit) { m_cacheLimit = limit; }

    const std::optional<std::string>& databasePath() const { return m_databasePath; }
    // Number of cached records; enters _sync, so never call it from there.
    size_t cachedRecordCount() const;

protected:
    explicit OMDatabase(std::optional<std::string> databasePath);
    // The fallible half of construction, run once the object is owned by a shared_ptr (observer
    // registration needs a weak reference to it). The annotation store is opened and the Registrar
    // observed here once those services are in the tree.
    Result<void> openDatabase();

    // The Registrar workspace and the annotation store join these members with those services.
    // Read and changed only on _sync.
    std::unordered_map<Uuid, std::shared_ptr<OMDPlugIn>> m_cache;
    const std::shared_ptr<WorkQueue> _sync;

private:
    std::weak_ptr<OMDatabaseDelegate> m_delegate;
    uint32_t m_cacheLimit = 0;
    const std::optional<std::string> m_databasePath;
};

} // namespace om

// What a RegistrarWorkspace holds, shared by the files its source is split into: opening and
// lookups (RegistrarWorkspace.cpp), registration and unregistration (RegistrarWorkspaceRegistration.cpp).
#pragma once

#include <memory>
#include <mutex>
#include <shared_mutex>
#include <string>
#include <unordered_map>

#include "platform/Log.h"
#include "platform/Registrar.h"
#include "platform/RegistrarBundleReader.h"
#include "platform/RegistrarIndex.h"
#include "platform/RegistrarNotifier.h"
#include "platform/RegistrarStore.h"

namespace om {

struct RegistrarWorkspace::State {
    State(Configuration configuration, Access access, std::unique_ptr<RegistrarStore> store)
        : configuration(std::move(configuration))
        , access(access)
        , store(std::move(store))
    {
    }

    using RecordResult = Result<std::shared_ptr<const RegistrarPlugInRecord>>;

    // What one bundle on disk says, read before the registry is held.
    struct Reading {
        std::string path; // canonical
        Value info; // as declared
        RegistrarBundleReader::PlugInFacts facts;
        std::optional<std::string> applicationPath;
    };
    // One registration to write, and the one it replaces.
    struct Change {
        size_t result; // the registration's place in the batch
        RegistrarStore::Row row;
        RegistrarBundleReader::PlugInFacts facts;
        std::shared_ptr<const RegistrarPlugInRecord> replaced;
    };

    static const Log& log();

    // The bundle at bundlePath, or why it is no plug-in; touches nothing but the bundle.
    Result<Reading> read(std::string_view bundlePath) const;
    // These run holding the notifier's queue.
    std::optional<Change> plan(size_t result, Reading& reading, RecordResult& unchanged);
    void commit(std::vector<Change>& changes, std::vector<RecordResult>& results);
    Result<void> unregister(std::string_view bundlePath);
    std::shared_ptr<const RegistrarPlugInRecord> registrationAt(std::string_view path) const;

    // The record of one stored registration, with its facts read again under today's SDK entries.
    std::shared_ptr<const RegistrarPlugInRecord> makeRecord(const RegistrarStore::Row& row,
        RegistrarBundleReader::PlugInFacts facts, std::shared_ptr<const RegistrarAppRecord> application) const;
    // The application at path as its Info.vlist says now; reuses known, which reads the same.
    static std::shared_ptr<const RegistrarAppRecord> readApplication(
        const std::string& path, const std::shared_ptr<const RegistrarAppRecord>& known);
    RegistrarBundleReader::SdkLookup sdkLookup() const;

    const Configuration configuration;
    const Access access;

    // Used only while holding the notifier's queue (and while opening).
    std::unique_ptr<RegistrarStore> store;
    uint64_t nextSequence = 1;

    // Held only to read or to update the index, never across disk I/O or a notification.
    mutable std::shared_mutex indexMutex;
    RegistrarIndex index;

    mutable std::mutex sdkMutex;
    mutable std::unordered_map<std::string, Value> sdkEntries;

    // Last, so that it is drained and stopped before anything its deliveries might reach goes.
    RegistrarNotifier notifier;
};

} // namespace om

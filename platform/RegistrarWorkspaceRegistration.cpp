// Registration and unregistration: read the bundle, announce what goes, commit, publish, announce
// what came. Every change runs holding the notification queue (RegistrarNotifier::serialize), which
// is what orders changes and their notifications; lookups meanwhile only wait for the moment the
// index is updated.
#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <filesystem>

#include "platform/Registrar.h"
#include "platform/RegistrarWorkspaceState.h"
#include "platform/Storage.h"

namespace om {

namespace {

double now()
{
    using namespace std::chrono;
    return duration<double>(system_clock::now().time_since_epoch()).count();
}

std::string_view withoutTrailingSlashes(std::string_view path)
{
    while (path.size() > 1 && path.back() == '/')
        path.remove_suffix(1);
    return path;
}

OMError registrarError(RegistrarErrorCode code, std::string description)
{
    return OMError(kRegistrarErrorDomain, code, std::move(description));
}

// <containers>/<identifier>, made 0700 when missing. None, and logged, when the identifier cannot
// name a directory or the directory cannot be made: the plug-in still registers, and the daemon
// decides what a plug-in without a container may do.
std::optional<std::string> dataContainer(const std::string& containers, const std::string& identifier, const Log& log)
{
    if (!Storage::isSafeComponent(identifier)) {
        log.info("no data container for \"%s\": the identifier cannot name a directory", identifier);
        return std::nullopt;
    }
    if (auto made = Storage::makeDirectories(containers, 0755); !made.ok()) {
        log.error("no data container for %s: %s", identifier, made.error().localizedDescription());
        return std::nullopt;
    }
    std::string path = containers + "/" + identifier;
    if (::mkdir(path.c_str(), 0700) < 0 && errno != EEXIST) {
        log.error("no data container for %s: %s", identifier,
            OMError::fromErrno("mkdir " + path, errno).localizedDescription());
        return std::nullopt;
    }
    struct stat status;
    if (::lstat(path.c_str(), &status) < 0 || !S_ISDIR(status.st_mode)) {
        log.error("no data container for %s: %s is not a directory", identifier, path);
        return std::nullopt;
    }
    return path;
}

std::optional<std::string> applicationPathOf(const RegistrarPlugInRecord& record)
{
    return record.containingApp() ? std::optional(record.containingApp()->path()) : std::nullopt;
}

} // namespace

Result<RegistrarWorkspace::State::Reading> RegistrarWorkspace::State::read(std::string_view bundlePath) const
{
    Reading reading;
    reading.path = OM_TRY(RegistrarBundleReader::canonicalPath(bundlePath));
    reading.info = OM_TRY(RegistrarBundleReader::readInfo(reading.path));
    reading.facts = OM_TRY(RegistrarBundleReader::plugInFacts(reading.path, reading.info, Value(), sdkLookup()));
    reading.facts.entitlements = RegistrarBundleReader::readEntitlements(reading.path, log());
    reading.applicationPath = RegistrarBundleReader::containingApplication(reading.path);
    return reading;
}

std::shared_ptr<const RegistrarPlugInRecord> RegistrarWorkspace::State::registrationAt(std::string_view path) const
{
    std::shared_lock lock(indexMutex);
    return index.atPath(path);
}

std::optional<RegistrarWorkspace::State::Change> RegistrarWorkspace::State::plan(
    size_t result, Reading& reading, RecordResult& unchanged)
{
    auto existing = registrationAt(reading.path);
    const bool sameIdentifier = existing && existing->identifier() == reading.facts.identifier;
    std::optional<std::string> container = reading.facts.isDataPlugIn
        ? std::nullopt
        : dataContainer(configuration.containersDirectory, reading.facts.identifier, log());
    if (sameIdentifier && existing->entitlements() == reading.facts.entitlements
        && existing->dataContainerPath() == container && applicationPathOf(*existing) == reading.applicationPath
        && store->declaredInfo(existing->uuid()) == reading.info) {
        unchanged = existing; // nothing to write, nobody to tell, the first date kept
        return std::nullopt;
    }
    return Change {
        .result = result,
        .row = RegistrarStore::Row {
            .uuid = sameIdentifier ? existing->uuid() : Uuid::random(),
            .path = reading.path,
            .identifier = reading.facts.identifier,
            .info = reading.info,
            .entitlements = reading.facts.entitlements,
            .registrationDate = now(),
            .containerPath = std::move(container),
            .applicationPath = reading.applicationPath,
        },
        .facts = std::move(reading.facts),
        .replaced = existing,
    };
}

void RegistrarWorkspace::State::commit(std::vector<Change>& changes, std::vector<RecordResult>& results)
{
    RegistrarPlugInRecords replaced;
    for (const Change& change : changes) {
        if (change.replaced)
            replaced.push_back(change.replaced);
    }
    notifier.announceUninstall(replaced);
    // An observer may have changed one of these paths from within its notification; that change
    // stands, and this one would now replace a registration nobody was told about.
    std::erase_if(changes, [&](const Change& change) {
        if (registrationAt(change.row.path) == change.replaced)
            return false;
        results[change.result] = registrarError(kRegistrarErrorRefused,
            change.row.path + " was registered again while its previous registration was being uninstalled");
        return true;
    });
    if (changes.empty())
        return;

    std::vector<Uuid> removed;
    std::vector<RegistrarStore::Row> rows;
    std::unordered_map<std::string, std::shared_ptr<const RegistrarAppRecord>> applications;
    for (Change& change : changes) {
        if (change.replaced)
            removed.push_back(change.replaced->uuid());
        change.row.sequence = nextSequence++;
        rows.push_back(change.row);
    }
    if (auto written = store->apply(removed, rows); !written.ok()) {
        log().error("%s", written.error().localizedDescription());
        for (const Change& change : changes)
            results[change.result] = written.error();
        // Nothing was removed after all: observers that were told otherwise hear of them again.
        notifier.announceInstall(replaced);
        return;
    }

    RegistrarPlugInRecords installed;
    for (Change& change : changes) {
        std::shared_ptr<const RegistrarAppRecord> application;
        if (const auto& path = change.row.applicationPath) {
            // Read once per commit: the plug-ins of one application share its record.
            auto [entry, first] = applications.try_emplace(*path);
            if (first) {
                std::shared_ptr<const RegistrarAppRecord> known;
                {
                    std::shared_lock lock(indexMutex);
                    known = index.application(*path);
                }
                entry->second = readApplication(*path, known);
            }
            application = entry->second;
        }
        installed.push_back(makeRecord(change.row, std::move(change.facts), std::move(application)));
        results[change.result] = installed.back();
    }
    {
        std::unique_lock lock(indexMutex);
        for (const Uuid& uuid : removed)
            index.remove(uuid);
        for (const auto& record : installed)
            index.insert(record);
    }
    notifier.announceInstall(std::move(installed));
}

Result<void> RegistrarWorkspace::State::unregister(std::string_view bundlePath)
{
    auto record = registrationAt(withoutTrailingSlashes(bundlePath));
    if (!record) {
        std::error_code error;
        auto canonical = std::filesystem::weakly_canonical(std::filesystem::path(bundlePath), error);
        if (!error)
            record = registrationAt(withoutTrailingSlashes(canonical.string()));
    }
    if (!record)
        return registrarError(kRegistrarErrorNotRegistered, "no plug-in is registered at " + std::string(bundlePath));

    notifier.announceUninstall({ record });
    {
        std::shared_lock lock(indexMutex);
        // Unregistered or replaced from within the notification: already gone.
        if (index.withUuid(record->uuid()) != record)
            return {};
    }
    const Uuid uuid = record->uuid();
    if (auto removed = store->apply({ &uuid, 1 }, {}); !removed.ok()) {
        log().error("%s", removed.error().localizedDescription());
        notifier.announceInstall({ record });
        return removed.error();
    }
    {
        std::unique_lock lock(indexMutex);
        index.remove(uuid);
    }
    return {};
}

Result<std::shared_ptr<const RegistrarPlugInRecord>> RegistrarWorkspace::registerPlugIn(std::string_view bundlePath)
{
    auto results = registerPlugIns({ std::string(bundlePath) });
    return std::move(results.front());
}

std::vector<Result<std::shared_ptr<const RegistrarPlugInRecord>>> RegistrarWorkspace::registerPlugIns(
    const std::vector<std::string>& bundlePaths)
{
    State& state = *m_state;
    if (state.access == Access::ReadOnly) {
        return std::vector<State::RecordResult>(
            bundlePaths.size(), registrarError(kRegistrarErrorReadOnly, "the registrar database was opened read-only"));
    }

    // Reading bundles needs nothing held: only what is written must be ordered.
    std::vector<State::RecordResult> results;
    std::vector<std::optional<State::Reading>> readings;
    results.reserve(bundlePaths.size());
    readings.reserve(bundlePaths.size());
    for (const std::string& path : bundlePaths) {
        auto reading = state.read(path);
        if (!reading.ok()) {
            State::log().info("not registering %s: %s", path, reading.error().localizedDescription());
            results.emplace_back(reading.error());
            readings.emplace_back();
            continue;
        }
        results.emplace_back(registrarError(kRegistrarErrorDatabase, "not registered"));
        readings.emplace_back(std::move(reading).releaseValue());
    }

    state.notifier.serialize([&] {
        std::vector<State::Change> changes;
        std::unordered_map<std::string, size_t> seen;
        for (size_t i = 0; i < readings.size(); ++i) {
            if (!readings[i])
                continue;
            if (!seen.emplace(readings[i]->path, i).second) {
                results[i] = registrarError(
                    kRegistrarErrorRefused, readings[i]->path + " is given more than once in one registration");
                continue;
            }
            if (auto change = state.plan(i, *readings[i], results[i]))
                changes.push_back(std::move(*change));
        }
        if (!changes.empty())
            state.commit(changes, results);
    });
    return results;
}

Result<void> RegistrarWorkspace::unregisterPlugIn(std::string_view bundlePath)
{
    State& state = *m_state;
    if (state.access == Access::ReadOnly)
        return registrarError(kRegistrarErrorReadOnly, "the registrar database was opened read-only");
    Result<void> result;
    state.notifier.serialize([&] { result = state.unregister(bundlePath); });
    return result;
}

} // namespace om

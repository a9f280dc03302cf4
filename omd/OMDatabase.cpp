#include "omd/OMDatabase.h"

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMLog.h"
#include "Ombrel/OMMakeError.h"
#include "omd/OMDAnnotationStore.h"
#include "omd/OMDPlugIn.h"

namespace om {

namespace {

constexpr const char* kAutoElectEntitlement = "com.orvex.developer.auto-elect-plugin";

std::string textOf(const std::optional<std::string>& text)
{
    return text ? *text : std::string("(null)");
}

// A file URL's path; a URL that is not one reads as the text it is, which no registration matches.
std::string pathOf(std::string_view url)
{
    auto path = OMBundle::pathOfFileURL(url);
    return path ? *path : std::string(url);
}

void logChange(const char* message, const RegistrarPlugInRecord& record)
{
    OMLog::ops().notice(message, textOf(record.bundleIdentifier()), textOf(record.identifier()),
        textOf(record.bundleVersion()), Value::uuid(record.uuid()), textOf(record.bundlePath()));
}

} // namespace

OMDatabase::OMDatabase(std::optional<std::string> databasePath)
    : _sync(WorkQueue::create("OMDatabase"))
    , m_databasePath(std::move(databasePath))
{
}

OMDatabase::~OMDatabase() = default;

std::shared_ptr<OMDatabase> OMDatabase::initWithDatabase(std::optional<std::string> databasePath)
{
    std::shared_ptr<OMDatabase> database(new OMDatabase(std::move(databasePath)));
    if (!database->openDatabase().ok())
        return nullptr;
    return database;
}

Result<void> OMDatabase::openDatabase()
{
    auto workspace = RegistrarWorkspace::defaultWorkspace();
    if (!workspace.ok()) {
        OMLog::ops().error("unable to open the Registrar: %s", workspace.error().localizedDescription());
        return workspace.error();
    }
    m_workspace = std::move(workspace).releaseValue();
    m_annotations = OMDAnnotationStore::initWithDatabase(m_databasePath);
    m_workspace->addObserver(std::static_pointer_cast<RegistrarObserver>(shared_from_this()));
    return {};
}

size_t OMDatabase::cachedRecordCount() const
{
    size_t count = 0;
    _sync->sync([&] { count = m_cache.size(); });
    return count;
}

std::shared_ptr<OMDPlugIn> OMDatabase::plugInForProxy(const std::shared_ptr<const RegistrarPlugInRecord>& proxy)
{
    std::shared_ptr<OMDPlugIn> plugIn;
    _sync->sync([&] {
        if (auto found = m_cache.find(proxy->uuid()); found != m_cache.end())
            plugIn = found->second;
        else
            plugIn = createPlugInForProxy(proxy);
    });
    return plugIn;
}

std::shared_ptr<OMDPlugIn> OMDatabase::createPlugInForProxy(const std::shared_ptr<const RegistrarPlugInRecord>& proxy)
{
    _sync->assertCurrent();
    auto plugIn = OMDPlugIn::initWithRGData(proxy);
    if (!plugIn)
        return nullptr;
    if (plugIn->hasEntitlement(kAutoElectEntitlement))
        autoElect(plugIn);
    purgeCachesToLimit(m_cacheLimit);
    cache(plugIn);
    return plugIn;
}

void OMDatabase::cache(const std::shared_ptr<OMDPlugIn>& plugIn)
{
    m_cache[plugIn->registrationUuid()] = plugIn;
    m_cachedCount.store(m_cache.size(), std::memory_order_relaxed);
}

void OMDatabase::purgeCachesToLimit(uint32_t limit)
{
    if (m_cache.size() <= limit)
        return;
    OMLog::ops().info("purging cache for %d > %d", static_cast<int>(m_cache.size()), static_cast<int>(limit));
    m_cache.clear();
    m_cachedCount.store(0, std::memory_order_relaxed);
    m_workspace->dropCaches();
}

std::shared_ptr<OMDPlugIn> OMDatabase::findPlugIn(const Uuid& uuid)
{
    std::shared_ptr<OMDPlugIn> plugIn;
    _sync->sync([&] {
        if (auto found = m_cache.find(uuid); found != m_cache.end()) {
            plugIn = found->second;
            return;
        }
        if (auto proxy = m_workspace->plugInWithUuid(uuid)) {
            plugIn = createPlugInForProxy(proxy);
            return;
        }
        OMLog::ops().info("Registrar cannot find plug-in with UUID:%{public}@", Value::uuid(uuid));
    });
    return plugIn;
}

std::shared_ptr<OMDPlugIn> OMDatabase::findPlugInAtPath(std::string_view url)
{
    const std::string path = pathOf(url);
    auto proxy = m_workspace->plugInAtPath(path);
    if (!proxy) {
        OMLog::ops().info("Registrar cannot find plug-in at path:%@", path);
        return nullptr;
    }
    return findPlugIn(proxy->uuid());
}

std::optional<OMDPlugIns> OMDatabase::plugInsWithinApplication(std::string_view url)
{
    auto proxies = m_workspace->plugInsOfApplication(pathOf(url));
    if (proxies.empty())
        return std::nullopt;
    OMDPlugIns plugIns;
    plugIns.reserve(proxies.size());
    for (const auto& proxy : proxies) {
        if (auto plugIn = plugInForProxy(proxy))
            plugIns.push_back(std::move(plugIn));
    }
    return plugIns;
}

std::optional<OMError> OMDatabase::addPlugIn(std::string_view url)
{
    const std::string path = pathOf(url);
    auto registered = m_workspace->registerPlugIn(path);
    // The Registrar has logged why it refused.
    if (registered.ok())
        return std::nullopt;
    return OMMakeError(2, "Registrar failed to register the plug-in");
}

std::optional<OMError> OMDatabase::removePlugIn(std::string_view url)
{
    const std::string path = pathOf(url);
    auto unregistered = m_workspace->unregisterPlugIn(path);
    if (unregistered.ok())
        return std::nullopt;
    return OMMakeError(2, "Registrar failed to deregister the plug-in");
}

void OMDatabase::pluginsDidInstall(const RegistrarPlugInRecords& records)
{
    for (const auto& record : records)
        logChange("plug-in INSTALLED:%@ %@(%@) %{public}@ %@", *record);
}

void OMDatabase::pluginsWillUninstall(const RegistrarPlugInRecords& records)
{
    _sync->sync([&] {
        for (const auto& record : records) {
            logChange("plug-in UNINSTALLED:%@ %@(%@) %{public}@ %@", *record);
            m_cache.erase(record->uuid());
        }
        m_cachedCount.store(m_cache.size(), std::memory_order_relaxed);
    });
    // Outside _sync: the delegate stops running instances, which may take its own locks.
    if (auto delegate = this->delegate())
        delegate->removedPlugIns(records);
}

} // namespace om

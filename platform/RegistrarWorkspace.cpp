#include <algorithm>

#include "platform/Registrar.h"
#include "platform/RegistrarSdk.h"
#include "platform/RegistrarWorkspaceState.h"
#include "platform/Storage.h"

namespace om {

namespace {

std::string_view withoutTrailingSlashes(std::string_view path)
{
    while (path.size() > 1 && path.back() == '/')
        path.remove_suffix(1);
    return path;
}

std::mutex g_defaultMutex;
std::shared_ptr<RegistrarWorkspace> g_default; // guarded by g_defaultMutex

} // namespace

const Log& RegistrarWorkspace::State::log()
{
    static const Log* log = [] {
        auto created = Log::create("com.orvex.platform", "registrar");
        return created.ok() ? new Log(*created.value()) : &Log::defaultLog();
    }();
    return *log;
}

RegistrarBundleReader::SdkLookup RegistrarWorkspace::State::sdkLookup() const
{
    return [this](std::string_view extensionPoint) {
        std::lock_guard lock(sdkMutex);
        auto found = sdkEntries.find(std::string(extensionPoint));
        if (found == sdkEntries.end())
            found = sdkEntries.emplace(extensionPoint, RegistrarSdk::read(configuration.sdkDirectory, extensionPoint))
                        .first;
        return found->second;
    };
}

std::shared_ptr<const RegistrarAppRecord> RegistrarWorkspace::State::readApplication(
    const std::string& path, const std::shared_ptr<const RegistrarAppRecord>& known)
{
    // An application whose Info.vlist cannot be read (an installer is replacing it) is still known
    // by its directory's name.
    auto info = RegistrarBundleReader::readInfo(path);
    auto facts = RegistrarBundleReader::appFacts(path, info.ok() ? info.value() : Value());
    if (known && known->path() == path && known->bundleIdentifier() == facts.bundleIdentifier
        && known->displayName() == facts.displayName)
        return known;
    return std::make_shared<const RegistrarAppRecord>(RegistrarAppRecord::Facts {
        .path = path, .bundleIdentifier = std::move(facts.bundleIdentifier), .displayName = facts.displayName });
}

std::shared_ptr<const RegistrarPlugInRecord> RegistrarWorkspace::State::makeRecord(const RegistrarStore::Row& row,
    RegistrarBundleReader::PlugInFacts facts, std::shared_ptr<const RegistrarAppRecord> application) const
{
    return std::make_shared<const RegistrarPlugInRecord>(RegistrarPlugInRecord::Facts {
        .uuid = row.uuid,
        .bundlePath = row.path,
        .identifier = std::move(facts.identifier),
        .originalIdentifier = std::move(facts.originalIdentifier),
        .bundleIdentifier = std::move(facts.bundleIdentifier),
        .bundleVersion = std::move(facts.bundleVersion),
        .infoDictionary = std::move(facts.infoDictionary),
        .plugInDictionary = std::move(facts.plugInDictionary),
        .entitlements = std::move(facts.entitlements),
        .registrationDate = row.registrationDate,
        .onSystemPartition = facts.onSystemPartition,
        .containingApp = std::move(application),
        .displayName = std::move(facts.displayName),
        .shortDisplayName = std::move(facts.shortDisplayName),
        .dataContainerPath = row.containerPath,
        .sequence = row.sequence,
    });
}

RegistrarWorkspace::Configuration RegistrarWorkspace::Configuration::fromEnvironment()
{
    const std::string userHome = Storage::dataHome() + "/omd";
    return Configuration {
        .databasePath = Storage::location("REGISTRAR_DB", "/var/lib/omd/registrar.db", userHome + "/registrar.db"),
        .sdkDirectory = RegistrarSdk::directory(),
        .containersDirectory
        = Storage::location("REGISTRAR_CONTAINERS", "/var/lib/omd/containers", userHome + "/containers"),
    };
}

RegistrarWorkspace::RegistrarWorkspace(std::unique_ptr<State> state)
    : m_state(std::move(state))
{
}

RegistrarWorkspace::~RegistrarWorkspace() = default;

Result<std::shared_ptr<RegistrarWorkspace>> RegistrarWorkspace::open(const Configuration& configuration, Access access)
{
    auto store = OM_TRY(RegistrarStore::open(configuration.databasePath, access, State::log()));
    auto rows = store->load();
    if (!rows.ok()) {
        State::log().error("%s", rows.error().localizedDescription());
        return rows.error();
    }
    auto state = std::make_unique<State>(configuration, access, std::move(store));
    state->nextSequence = state->store->lastSequence() + 1;

    // Plug-ins of one application share its record, read once.
    std::unordered_map<std::string, std::shared_ptr<const RegistrarAppRecord>> applications;
    for (RegistrarStore::Row& row : *rows) {
        auto facts = RegistrarBundleReader::plugInFacts(row.path, row.info, row.entitlements, state->sdkLookup());
        if (!facts.ok()) {
            State::log().error("registrar database %s: registration of %s is left out: %s", configuration.databasePath,
                row.path, facts.error().localizedDescription());
            continue;
        }
        std::shared_ptr<const RegistrarAppRecord> application;
        if (row.applicationPath) {
            auto& known = applications[*row.applicationPath];
            if (!known)
                known = State::readApplication(*row.applicationPath, nullptr);
            application = known;
        }
        auto record = state->makeRecord(row, std::move(facts).releaseValue(), std::move(application));
        state->index.insert(record);
    }
    return std::shared_ptr<RegistrarWorkspace>(new RegistrarWorkspace(std::move(state)));
}

Result<std::shared_ptr<RegistrarWorkspace>> RegistrarWorkspace::defaultWorkspace()
{
    std::lock_guard lock(g_defaultMutex);
    if (!g_default)
        g_default = OM_TRY(open(Configuration::fromEnvironment(), Access::ReadWrite));
    return g_default;
}

void RegistrarWorkspace::setDefaultWorkspace(std::shared_ptr<RegistrarWorkspace> workspace)
{
    std::lock_guard lock(g_defaultMutex);
    g_default = std::move(workspace);
}

const RegistrarWorkspace::Configuration& RegistrarWorkspace::configuration() const
{
    return m_state->configuration;
}

std::shared_ptr<const RegistrarPlugInRecord> RegistrarWorkspace::plugInWithUuid(const Uuid& uuid) const
{
    std::shared_lock lock(m_state->indexMutex);
    return m_state->index.withUuid(uuid);
}

std::shared_ptr<const RegistrarPlugInRecord> RegistrarWorkspace::plugInAtPath(std::string_view bundlePath) const
{
    std::shared_lock lock(m_state->indexMutex);
    return m_state->index.atPath(withoutTrailingSlashes(bundlePath));
}

std::shared_ptr<const RegistrarAppRecord> RegistrarWorkspace::applicationAtPath(std::string_view bundlePath) const
{
    std::shared_lock lock(m_state->indexMutex);
    return m_state->index.application(withoutTrailingSlashes(bundlePath));
}

RegistrarPlugInRecords RegistrarWorkspace::plugInsOfApplication(std::string_view applicationPath) const
{
    std::shared_lock lock(m_state->indexMutex);
    return m_state->index.plugInsOfApplication(withoutTrailingSlashes(applicationPath));
}

RegistrarPlugInRecords RegistrarWorkspace::allPlugIns() const
{
    std::shared_lock lock(m_state->indexMutex);
    return m_state->index.all();
}

std::vector<std::shared_ptr<const RegistrarAppRecord>> RegistrarWorkspace::allApplications() const
{
    std::shared_lock lock(m_state->indexMutex);
    return m_state->index.applications();
}

size_t RegistrarWorkspace::plugInCount() const
{
    std::shared_lock lock(m_state->indexMutex);
    return m_state->index.count();
}

RegistrarPlugInRecords RegistrarWorkspace::query(const Value& rules, const CandidateFilter& filter) const
{
    RegistrarPlugInRecords candidates;
    {
        std::shared_lock lock(m_state->indexMutex);
        candidates = m_state->index.candidates(rules);
    }
    // The filter runs unlocked: it reads the caller's own stores and may look records up again.
    if (filter) {
        std::erase_if(candidates, [&](const auto& record) {
            static const std::string kNoIdentifier;
            return !filter(record->identifier() ? *record->identifier() : kNoIdentifier, record->entitlements());
        });
    }
    return candidates;
}

Value RegistrarWorkspace::sdkEntry(std::string_view extensionPointIdentifier) const
{
    return m_state->sdkLookup()(extensionPointIdentifier);
}

void RegistrarWorkspace::dropCaches()
{
    std::lock_guard lock(m_state->sdkMutex);
    m_state->sdkEntries.clear();
}

void RegistrarWorkspace::addObserver(std::weak_ptr<RegistrarObserver> observer)
{
    m_state->notifier.addObserver(std::move(observer));
}

void RegistrarWorkspace::waitForNotifications() const
{
    m_state->notifier.waitForNotifications();
}

} // namespace om

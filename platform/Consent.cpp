#include "platform/Consent.h"

#include <sys/stat.h>

#include <cerrno>

#include "platform/Storage.h"

#include <sqlite3.h>

namespace om {

namespace {

constexpr int kSchemaVersion = 1;
constexpr const char* kSchema = R"(
CREATE TABLE grants (
    bundle TEXT NOT NULL,
    service TEXT NOT NULL,
    granted INTEGER NOT NULL CHECK (granted IN (0, 1)),
    PRIMARY KEY (bundle, service)
) STRICT;
)";
// rowid keeps the order in which a pair was first recorded; an upsert does not change it.
constexpr const char* kSelect = "SELECT service, granted FROM grants WHERE bundle = ? ORDER BY rowid";
constexpr const char* kUpsert = "INSERT INTO grants (bundle, service, granted) VALUES (?, ?, ?) "
                                "ON CONFLICT (bundle, service) DO UPDATE SET granted = excluded.granted";
// omctl may be writing while the daemon reads.
constexpr int kBusyTimeoutMs = 10'000;

std::string directoryOf(const std::string& path)
{
    const size_t slash = path.rfind('/');
    if (slash == std::string::npos)
        return ".";
    return slash == 0 ? "/" : path.substr(0, slash);
}

struct Statement {
    sqlite3_stmt* statement = nullptr;
    Statement() = default;
    Statement(const Statement&) = delete;
    Statement& operator=(const Statement&) = delete;
    ~Statement() { sqlite3_finalize(statement); }
};

} // namespace

std::string Consent::defaultPath()
{
    return Storage::location("CONSENT_DB", "/var/lib/omd/consent.db", Storage::dataHome() + "/omd/consent.db");
}

Consent::Consent(std::string path, sqlite3* database)
    : m_path(std::move(path))
    , m_database(database)
{
}

Consent::~Consent()
{
    sqlite3_close_v2(m_database);
}

OMError Consent::failure(const std::string& what) const
{
    return OMError(kErrorDomain, 1,
        "consent database " + m_path + ": " + what + ": "
            + (m_database ? sqlite3_errmsg(m_database) : "out of memory"));
}

Result<std::unique_ptr<Consent>> Consent::open(const std::string& path, Access access)
{
    const bool writable = access == Access::ReadWrite;
    struct stat file { };
    const bool exists = ::stat(path.c_str(), &file) == 0;
    if (!exists && (errno != ENOENT || !writable))
        return OMError(kErrorDomain, 1,
            "consent database " + path + ": " + OMError::fromErrno("stat", errno).localizedDescription());
    if (!exists) {
        if (auto made = Storage::makeDirectories(directoryOf(path)); !made.ok())
            return OMError(kErrorDomain, 1, "consent database " + path + ": " + made.error().localizedDescription());
    }
    // An existing file is opened without SQLITE_OPEN_CREATE so that one removed under us is never
    // silently made anew.
    const int flags = SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE
        | (writable ? SQLITE_OPEN_READWRITE | (exists ? 0 : SQLITE_OPEN_CREATE) : SQLITE_OPEN_READONLY);
    sqlite3* database = nullptr;
    const int status = sqlite3_open_v2(path.c_str(), &database, flags, nullptr);
    std::unique_ptr<Consent> consent(new Consent(path, database));
    if (status != SQLITE_OK)
        return consent->failure("open");
    sqlite3_busy_timeout(database, kBusyTimeoutMs);
    OM_TRY(consent->verify(access));
    return consent;
}

Result<void> Consent::verify(Access access)
{
    // The first read of the file: one that is no database fails here, before anything is written.
    int version = 0;
    {
        Statement query;
        if (sqlite3_prepare_v2(m_database, "PRAGMA user_version", -1, &query.statement, nullptr) != SQLITE_OK
            || sqlite3_step(query.statement) != SQLITE_ROW)
            return failure("reading the schema version");
        version = sqlite3_column_int(query.statement, 0);
    }
    if (version != 0 && version != kSchemaVersion)
        return OMError(kErrorDomain, 1,
            "consent database " + m_path + ": schema version " + std::to_string(version) + " is not "
                + std::to_string(kSchemaVersion));
    if (version == 0) {
        Statement tables;
        if (sqlite3_prepare_v2(m_database, "SELECT count(*) FROM sqlite_schema", -1, &tables.statement, nullptr)
                != SQLITE_OK
            || sqlite3_step(tables.statement) != SQLITE_ROW)
            return failure("reading the schema");
        if (sqlite3_column_int(tables.statement, 0) != 0)
            return OMError(kErrorDomain, 1,
                "consent database " + m_path + ": not a consent database (it has tables but no schema version)");
        if (access == Access::ReadOnly)
            return {}; // made but never written: as good as empty
    }
    if (access == Access::ReadOnly)
        return execute("PRAGMA query_only = ON");
    // A change is acknowledged only once it is on disk.
    OM_TRY(execute("PRAGMA synchronous = FULL"));
    if (version == 0) {
        OM_TRY(execute("BEGIN IMMEDIATE"));
        auto created = execute(kSchema);
        if (created.ok())
            created = execute(("PRAGMA user_version = " + std::to_string(kSchemaVersion)).c_str());
        if (!created.ok()) {
            (void)execute("ROLLBACK"); // the failure to report is the one above
            return created;
        }
        return execute("COMMIT");
    }
    return {};
}

Result<void> Consent::execute(const char* sql)
{
    char* message = nullptr;
    if (sqlite3_exec(m_database, sql, nullptr, nullptr, &message) == SQLITE_OK)
        return {};
    const std::string text = message ? message : sqlite3_errmsg(m_database);
    sqlite3_free(message);
    return OMError(kErrorDomain, 1, "consent database " + m_path + ": " + text);
}

Result<std::vector<Consent::Entry>> Consent::entries(const std::string& bundleIdentifier)
{
    std::vector<Entry> found;
    Statement query;
    if (sqlite3_prepare_v2(m_database, kSelect, -1, &query.statement, nullptr) != SQLITE_OK) {
        // A database made by a reader before anyone wrote to it has no table yet.
        if (sqlite3_errcode(m_database) == SQLITE_ERROR)
            return found;
        return failure("preparing a query");
    }
    sqlite3_bind_text(query.statement, 1, bundleIdentifier.data(), int(bundleIdentifier.size()), SQLITE_STATIC);
    int status = SQLITE_ROW;
    while ((status = sqlite3_step(query.statement)) == SQLITE_ROW) {
        const auto* service = reinterpret_cast<const char*>(sqlite3_column_text(query.statement, 0));
        found.push_back(
            Entry { .service = service ? service : "", .granted = sqlite3_column_int(query.statement, 1) != 0 });
    }
    if (status != SQLITE_DONE)
        return failure("reading grants");
    return found;
}

Result<void> Consent::set(const std::string& bundleIdentifier, const std::string& service, bool granted)
{
    Statement upsert;
    if (sqlite3_prepare_v2(m_database, kUpsert, -1, &upsert.statement, nullptr) != SQLITE_OK)
        return failure("preparing an update");
    sqlite3_bind_text(upsert.statement, 1, bundleIdentifier.data(), int(bundleIdentifier.size()), SQLITE_STATIC);
    sqlite3_bind_text(upsert.statement, 2, service.data(), int(service.size()), SQLITE_STATIC);
    sqlite3_bind_int(upsert.statement, 3, granted ? 1 : 0);
    if (sqlite3_step(upsert.statement) != SQLITE_DONE)
        return failure("recording a grant");
    return {};
}

Result<std::vector<Consent::Entry>> Consent::informationForBundle(
    const std::string& path, const std::string& bundleIdentifier)
{
    struct stat file { };
    if (::stat(path.c_str(), &file) != 0 && errno == ENOENT)
        return std::vector<Entry> {};
    auto consent = OM_TRY(open(path, Access::ReadOnly));
    return consent->entries(bundleIdentifier);
}

} // namespace om

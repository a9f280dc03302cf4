#include "platform/RegistrarStore.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "platform/Storage.h"
#include "platform/Vlist.h"

#include <sqlite3.h>

namespace om {

namespace {

constexpr const char* kSchema = R"(
CREATE TABLE registrations (
    sequence INTEGER PRIMARY KEY,
    uuid BLOB NOT NULL UNIQUE CHECK (length(uuid) = 16),
    path TEXT NOT NULL UNIQUE,
    identifier TEXT NOT NULL,
    info BLOB NOT NULL,
    entitlements BLOB,
    registered REAL NOT NULL,
    container TEXT,
    application TEXT
) STRICT;
CREATE INDEX registrations_by_identifier ON registrations (identifier);
)";

constexpr const char* kSelectAll
    = "SELECT sequence, uuid, path, identifier, info, entitlements, registered, container, "
      "application FROM registrations ORDER BY sequence";
constexpr const char* kInsert = "INSERT INTO registrations (sequence, uuid, path, identifier, info, entitlements, "
                                "registered, container, application) VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?)";
constexpr const char* kDelete = "DELETE FROM registrations WHERE uuid = ?";
constexpr const char* kDeletePath = "DELETE FROM registrations WHERE path = ?";
constexpr const char* kSelectInfo = "SELECT info FROM registrations WHERE uuid = ?";

// Another process (omctl reading, a second daemon by mistake) may hold the file for a moment.
constexpr int kBusyTimeoutMs = 10'000;

std::string directoryOf(const std::string& path)
{
    size_t slash = path.rfind('/');
    if (slash == std::string::npos)
        return ".";
    return slash == 0 ? "/" : path.substr(0, slash);
}

std::string columnText(sqlite3_stmt* row, int column)
{
    const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(row, column));
    return text ? std::string(text, size_t(sqlite3_column_bytes(row, column))) : std::string();
}

std::optional<std::string> optionalText(sqlite3_stmt* row, int column)
{
    if (sqlite3_column_type(row, column) == SQLITE_NULL)
        return std::nullopt;
    return columnText(row, column);
}

std::span<const uint8_t> columnBlob(sqlite3_stmt* row, int column)
{
    const auto* bytes = static_cast<const uint8_t*>(sqlite3_column_blob(row, column));
    return { bytes, bytes ? size_t(sqlite3_column_bytes(row, column)) : 0 };
}

// Finalises a statement prepared for one use.
struct StatementGuard {
    sqlite3_stmt* statement = nullptr;
    ~StatementGuard() { sqlite3_finalize(statement); }
};

} // namespace

RegistrarStore::RegistrarStore(std::string path, sqlite3* database, const Log& log)
    : m_path(std::move(path))
    , m_database(database)
    , m_log(log)
{
}

RegistrarStore::~RegistrarStore()
{
    sqlite3_finalize(m_insert);
    sqlite3_finalize(m_delete);
    sqlite3_finalize(m_selectInfo);
    sqlite3_finalize(m_deletePath);
    sqlite3_close_v2(m_database);
}

OMError RegistrarStore::failure(const std::string& what) const
{
    return OMError(kRegistrarErrorDomain, kRegistrarErrorDatabase,
        "registrar database " + m_path + ": " + what + ": "
            + (m_database ? sqlite3_errmsg(m_database) : "out of memory"));
}

Result<std::unique_ptr<RegistrarStore>> RegistrarStore::open(
    const std::string& path, RegistrarWorkspace::Access access, const Log& log)
{
    auto refuse = [&](OMError error) -> Result<std::unique_ptr<RegistrarStore>> {
        log.error("%s", error.localizedDescription());
        return error;
    };
    const bool writable = access == RegistrarWorkspace::Access::ReadWrite;
    struct stat file;
    const bool exists = ::stat(path.c_str(), &file) == 0;
    if (!exists && (errno != ENOENT || !writable)) {
        return refuse(OMError(kRegistrarErrorDomain, kRegistrarErrorDatabase,
            "registrar database " + path + ": " + OMError::fromErrno("stat", errno).localizedDescription()));
    }
    if (!exists) {
        if (auto made = Storage::makeDirectories(directoryOf(path)); !made.ok()) {
            return refuse(OMError(kRegistrarErrorDomain, kRegistrarErrorDatabase,
                "registrar database " + path + ": " + made.error().localizedDescription()));
        }
    }

    // SQLite opens its files close-on-exec; an existing file is opened without SQLITE_OPEN_CREATE
    // so that a file replaced under us is never silently made anew.
    int flags = SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE
        | (writable ? SQLITE_OPEN_READWRITE | (exists ? 0 : SQLITE_OPEN_CREATE) : SQLITE_OPEN_READONLY);
    sqlite3* database = nullptr;
    int status = sqlite3_open_v2(path.c_str(), &database, flags, nullptr);
    std::unique_ptr<RegistrarStore> store(new RegistrarStore(path, database, log));
    if (status != SQLITE_OK)
        return refuse(store->failure("open"));
    sqlite3_busy_timeout(database, kBusyTimeoutMs);
    if (auto verified = store->verify(access); !verified.ok())
        return refuse(verified.error());
    return store;
}

Result<void> RegistrarStore::verify(RegistrarWorkspace::Access access)
{
    // Reading the version is the first read of the file: a file that is not a database fails here,
    // before anything could be written to it.
    int version = 0;
    {
        StatementGuard query;
        if (sqlite3_prepare_v2(m_database, "PRAGMA user_version", -1, &query.statement, nullptr) != SQLITE_OK
            || sqlite3_step(query.statement) != SQLITE_ROW)
            return failure("reading the schema version");
        version = sqlite3_column_int(query.statement, 0);
    }
    if (version > kSchemaVersion) {
        return OMError(kRegistrarErrorDomain, kRegistrarErrorDatabase,
            "registrar database " + m_path + ": schema version " + std::to_string(version)
                + " is newer than this program's " + std::to_string(kSchemaVersion));
    }
    {
        StatementGuard check;
        if (sqlite3_prepare_v2(m_database, "PRAGMA quick_check", -1, &check.statement, nullptr) != SQLITE_OK
            || sqlite3_step(check.statement) != SQLITE_ROW)
            return failure("quick_check");
        std::string verdict = columnText(check.statement, 0);
        std::replace(verdict.begin(), verdict.end(), '\n', ' '); // one log line
        if (verdict != "ok") {
            return OMError(kRegistrarErrorDomain, kRegistrarErrorDatabase,
                "registrar database " + m_path + ": damaged (quick_check: " + verdict + ")");
        }
    }
    if (version == 0) {
        // Version 0 with tables is somebody else's database; ours starts empty.
        StatementGuard tables;
        if (sqlite3_prepare_v2(m_database, "SELECT count(*) FROM sqlite_schema", -1, &tables.statement, nullptr)
                != SQLITE_OK
            || sqlite3_step(tables.statement) != SQLITE_ROW)
            return failure("reading the schema");
        if (sqlite3_column_int(tables.statement, 0) != 0) {
            return OMError(kRegistrarErrorDomain, kRegistrarErrorDatabase,
                "registrar database " + m_path + ": not a Registrar database (it has tables but no schema version)");
        }
    }

    if (access == RegistrarWorkspace::Access::ReadOnly)
        return execute("PRAGMA query_only = ON");
    // A write is acknowledged only once it is committed to disk.
    OM_TRY(execute("PRAGMA journal_mode = WAL"));
    OM_TRY(execute("PRAGMA synchronous = FULL"));
    if (version == 0)
        OM_TRY(createSchema());
    return {};
}

Result<void> RegistrarStore::createSchema()
{
    OM_TRY(execute("BEGIN IMMEDIATE"));
    auto created = [&]() -> Result<void> {
        OM_TRY(execute(kSchema));
        return execute(("PRAGMA user_version = " + std::to_string(kSchemaVersion)).c_str());
    }();
    if (!created.ok()) {
        (void)execute("ROLLBACK"); // the failure to report is the one above
        return created;
    }
    return execute("COMMIT");
}

Result<void> RegistrarStore::execute(const char* sql)
{
    char* message = nullptr;
    if (sqlite3_exec(m_database, sql, nullptr, nullptr, &message) == SQLITE_OK)
        return {};
    std::string text = message ? message : sqlite3_errmsg(m_database);
    sqlite3_free(message);
    std::string statementText(sql);
    return OMError(kRegistrarErrorDomain, kRegistrarErrorDatabase,
        "registrar database " + m_path + ": " + statementText.substr(0, statementText.find_first_of("(\n")) + ": "
            + text);
}

Result<sqlite3_stmt*> RegistrarStore::statement(sqlite3_stmt*& cache, const char* sql)
{
    if (!cache && sqlite3_prepare_v3(m_database, sql, -1, SQLITE_PREPARE_PERSISTENT, &cache, nullptr) != SQLITE_OK)
        return failure("preparing a statement");
    sqlite3_reset(cache);
    sqlite3_clear_bindings(cache);
    return cache;
}

std::optional<RegistrarStore::Row> RegistrarStore::decode(sqlite3_stmt* row)
{
    Row decoded;
    decoded.sequence = uint64_t(sqlite3_column_int64(row, 0));
    auto uuid = columnBlob(row, 1);
    auto info = Vlist::parse(columnBlob(row, 4));
    if (uuid.size() != 16 || !info.ok() || !info->isDictionary())
        return std::nullopt;
    Uuid::Bytes bytes;
    std::memcpy(bytes.data(), uuid.data(), bytes.size());
    decoded.uuid = Uuid(bytes);
    decoded.path = columnText(row, 2);
    decoded.identifier = columnText(row, 3);
    decoded.info = std::move(info).releaseValue();
    if (sqlite3_column_type(row, 5) != SQLITE_NULL) {
        auto entitlements = Vlist::parse(columnBlob(row, 5));
        if (!entitlements.ok() || !entitlements->isDictionary())
            return std::nullopt;
        decoded.entitlements = std::move(entitlements).releaseValue();
    }
    decoded.registrationDate = sqlite3_column_double(row, 6);
    decoded.containerPath = optionalText(row, 7);
    decoded.applicationPath = optionalText(row, 8);
    return decoded;
}

Result<std::vector<RegistrarStore::Row>> RegistrarStore::load()
{
    std::vector<Row> rows;
    StatementGuard query;
    int status = sqlite3_prepare_v2(m_database, kSelectAll, -1, &query.statement, nullptr);
    if (status != SQLITE_OK) {
        // A read-only look at a database that was never written has no table yet.
        if (sqlite3_db_readonly(m_database, "main") == 1 && std::strstr(sqlite3_errmsg(m_database), "no such table"))
            return rows;
        return failure("reading registrations");
    }
    while ((status = sqlite3_step(query.statement)) == SQLITE_ROW) {
        m_lastSequence = std::max(m_lastSequence, uint64_t(sqlite3_column_int64(query.statement, 0)));
        if (auto row = decode(query.statement)) {
            rows.push_back(std::move(*row));
            continue;
        }
        m_log.error("registrar database %s: registration %lld does not decode; left out", m_path,
            static_cast<long long>(sqlite3_column_int64(query.statement, 0)));
    }
    if (status != SQLITE_DONE)
        return failure("reading registrations");
    return rows;
}

Value RegistrarStore::declaredInfo(const Uuid& uuid)
{
    auto select = statement(m_selectInfo, kSelectInfo);
    if (!select.ok())
        return {};
    sqlite3_bind_blob(*select, 1, uuid.bytes().data(), int(uuid.bytes().size()), SQLITE_STATIC);
    if (sqlite3_step(*select) != SQLITE_ROW)
        return {};
    auto info = Vlist::parse(columnBlob(*select, 0));
    sqlite3_reset(*select);
    return info.ok() ? std::move(info).releaseValue() : Value();
}

Result<void> RegistrarStore::apply(std::span<const Uuid> removed, std::span<const Row> inserted)
{
    if (removed.empty() && inserted.empty())
        return {};
    OM_TRY(execute("BEGIN IMMEDIATE"));
    auto applied = applyInTransaction(removed, inserted);
    if (!applied.ok()) {
        (void)execute("ROLLBACK"); // the failure to report is the one above
        return applied;
    }
    return execute("COMMIT");
}

Result<void> RegistrarStore::applyInTransaction(std::span<const Uuid> removed, std::span<const Row> inserted)
{
    for (const Uuid& uuid : removed) {
        sqlite3_stmt* remove = OM_TRY(statement(m_delete, kDelete));
        sqlite3_bind_blob(remove, 1, uuid.bytes().data(), int(uuid.bytes().size()), SQLITE_STATIC);
        if (sqlite3_step(remove) != SQLITE_DONE)
            return failure("removing a registration");
    }
    for (const Row& row : inserted) {
        sqlite3_stmt* stale = OM_TRY(statement(m_deletePath, kDeletePath));
        sqlite3_bind_text(stale, 1, row.path.data(), int(row.path.size()), SQLITE_STATIC);
        if (sqlite3_step(stale) != SQLITE_DONE)
            return failure("removing a registration");
        sqlite3_stmt* insert = OM_TRY(statement(m_insert, kInsert));
        std::vector<uint8_t> info = Vlist::writeBinary(row.info);
        std::vector<uint8_t> entitlements
            = row.entitlements.isNone() ? std::vector<uint8_t>() : Vlist::writeBinary(row.entitlements);
        sqlite3_bind_int64(insert, 1, sqlite3_int64(row.sequence));
        sqlite3_bind_blob(insert, 2, row.uuid.bytes().data(), int(row.uuid.bytes().size()), SQLITE_STATIC);
        sqlite3_bind_text(insert, 3, row.path.data(), int(row.path.size()), SQLITE_STATIC);
        sqlite3_bind_text(insert, 4, row.identifier.data(), int(row.identifier.size()), SQLITE_STATIC);
        sqlite3_bind_blob(insert, 5, info.data(), int(info.size()), SQLITE_STATIC);
        if (!row.entitlements.isNone())
            sqlite3_bind_blob(insert, 6, entitlements.data(), int(entitlements.size()), SQLITE_STATIC);
        sqlite3_bind_double(insert, 7, row.registrationDate);
        if (row.containerPath)
            sqlite3_bind_text(insert, 8, row.containerPath->data(), int(row.containerPath->size()), SQLITE_STATIC);
        if (row.applicationPath)
            sqlite3_bind_text(insert, 9, row.applicationPath->data(), int(row.applicationPath->size()), SQLITE_STATIC);
        if (sqlite3_step(insert) != SQLITE_DONE)
            return failure("writing a registration");
    }
    return {};
}

} // namespace om

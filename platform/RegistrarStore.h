// The Registrar's SQLite file: one row per registration, holding what the bundle said (its raw
// Info value and entitlements) rather than what was derived from it, so that records are rebuilt
// at every open under the SDK entries of that moment.
//
// The file is in WAL mode with synchronous=FULL: apply() returns once its transaction is on disk.
// Opening never repairs, discards or rewrites a file it does not recognise: a damaged file, a file
// that is not a database, or one of a newer schema is an error that names the file and the problem.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/Log.h"
#include "platform/Registrar.h"
#include "platform/Result.h"
#include "platform/Uuid.h"
#include "platform/Value.h"

struct sqlite3;
struct sqlite3_stmt;

namespace om {

class RegistrarStore {
public:
    static constexpr int kSchemaVersion = 1;

    struct Row {
        uint64_t sequence = 0; // registration order
        Uuid uuid;
        std::string path; // canonical bundle path
        std::string identifier;
        Value info; // the bundle's own Info dictionary
        Value entitlements; // none when the executable grants none
        double registrationDate = 0; // seconds since 1970
        std::optional<std::string> containerPath;
        std::optional<std::string> applicationPath;
    };

    // A failure is logged once, at error level, and returned.
    static Result<std::unique_ptr<RegistrarStore>> open(
        const std::string& path, RegistrarWorkspace::Access access, const Log& log);
    ~RegistrarStore();
    RegistrarStore(const RegistrarStore&) = delete;
    RegistrarStore& operator=(const RegistrarStore&) = delete;

    const std::string& path() const { return m_path; }

    // Every registration, in registration order. A row that no longer decodes is logged and left
    // out (and left in the file).
    Result<std::vector<Row>> load();
    // The highest sequence load() saw, rows left out included: new registrations go above it.
    uint64_t lastSequence() const { return m_lastSequence; }
    // What the bundle registered under uuid declared, read back from the file (kept there rather
    // than in memory: only a refresh asks); none when there is no such registration or it does not
    // decode.
    Value declaredInfo(const Uuid& uuid);
    // One transaction: the registrations with the removed UUIDs go, the inserted rows come (each
    // replacing whatever is stored at its path, a row load() left out included).
    Result<void> apply(std::span<const Uuid> removed, std::span<const Row> inserted);

private:
    RegistrarStore(std::string path, sqlite3* database, const Log& log);

    OMError failure(const std::string& what) const;
    Result<void> execute(const char* sql);
    Result<sqlite3_stmt*> statement(sqlite3_stmt*& cache, const char* sql);
    Result<void> verify(RegistrarWorkspace::Access access);
    Result<void> createSchema();
    Result<void> applyInTransaction(std::span<const Uuid> removed, std::span<const Row> inserted);
    std::optional<Row> decode(sqlite3_stmt* row);

    const std::string m_path;
    sqlite3* m_database;
    const Log& m_log;
    sqlite3_stmt* m_insert = nullptr;
    sqlite3_stmt* m_delete = nullptr;
    sqlite3_stmt* m_selectInfo = nullptr;
    sqlite3_stmt* m_deletePath = nullptr;
    uint64_t m_lastSequence = 0;
};

} // namespace om

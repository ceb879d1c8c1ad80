#pragma once

#include "bench/Process.h"
#include "bench/Timing.h"

#include <memory>
#include <sqlite3.h>
#include <string>
#include <vector>

/// The least that a start can do with what the registry has stored: to read it.
namespace bench {

class RegistryTables {
public:
    explicit RegistryTables(const std::string& root) {
        const std::string path = root + "/var/db/Catalix.sqlite";
        sqlite3* opened = nullptr;
        const int result = sqlite3_open_v2(path.c_str(), &opened, SQLITE_OPEN_READWRITE, nullptr);
        _database.reset(opened);
        if (result != SQLITE_OK) failHere();
    }

    /// Every row of every table, with one query for each table; how many there were.
    std::size_t readAll() {
        std::vector<std::string> tables;
        forEachRow("SELECT name FROM sqlite_master WHERE type = 'table'", [&](sqlite3_stmt* row) {
            tables.emplace_back(reinterpret_cast<const char*>(sqlite3_column_text(row, 0)));
        });
        std::size_t rows = 0;
        for (const auto& table : tables) {
            forEachRow("SELECT * FROM " + table, [&](sqlite3_stmt* row) {
                // Values are only read from their pages when they are asked for.
                for (int column = 0; column < sqlite3_column_count(row); ++column) {
                    if (sqlite3_column_type(row, column) == SQLITE_BLOB)
                        sqlite3_column_blob(row, column);
                    else
                        sqlite3_column_int64(row, column);
                }
                ++rows;
            });
        }
        return rows;
    }

private:
    struct Close {
        void operator()(sqlite3* database) const { sqlite3_close(database); }
    };
    struct Finalize {
        void operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }
    };

    [[noreturn]] void failHere() { fail(std::string("the registry's database: ") + sqlite3_errmsg(_database.get())); }

    template <class F> void forEachRow(const std::string& query, F&& use) {
        sqlite3_stmt* prepared = nullptr;
        if (sqlite3_prepare_v2(_database.get(), query.c_str(), -1, &prepared, nullptr) != SQLITE_OK) failHere();
        const std::unique_ptr<sqlite3_stmt, Finalize> statement(prepared);
        int result = SQLITE_OK;
        while ((result = sqlite3_step(prepared)) == SQLITE_ROW) use(prepared);
        if (result != SQLITE_DONE) failHere();
    }

    std::unique_ptr<sqlite3, Close> _database;
};

/// Milliseconds to open the database and read everything. Fails when there are fewer rows than `expected`.
inline double readRegistryTables(const std::string& root, std::size_t expected) {
    const double start = secondsNow();
    if (RegistryTables(root).readAll() < expected) fail("the registry has not stored everything");
    return (secondsNow() - start) * 1e3;
}

} // namespace bench

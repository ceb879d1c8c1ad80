#include "platform/linux/RegistryStore.h"

#include "platform/linux/Descriptor.h"
#include "platform/linux/HeapGrowth.h"

#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <iterator>
#include <span>
#include <sqlite3.h>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr int schemaVersion = 1;
/// The daemon's service lock keeps a second one away; whoever looks into the file by hand is not waited for long.
constexpr int busyTimeout = 250; // milliseconds

constexpr const char* schema = R"(
CREATE TABLE knowledge (uuid BLOB NOT NULL, sequence INTEGER NOT NULL);
CREATE TABLE application (
    path BLOB PRIMARY KEY, device INTEGER, inode INTEGER, birth INTEGER, evidence INTEGER, fingerprint INTEGER,
    resources INTEGER, executable BLOB, info BLOB NOT NULL, entitlements BLOB);
CREATE TABLE plugIn (
    path BLOB PRIMARY KEY, device INTEGER, inode INTEGER, birth INTEGER, evidence INTEGER, fingerprint INTEGER,
    resources INTEGER, executable BLOB, info BLOB NOT NULL, entitlements BLOB,
    uuid BLOB NOT NULL UNIQUE, identifier BLOB, originalIdentifier BLOB, registered REAL, application BLOB);
CREATE TABLE registration (path BLOB PRIMARY KEY);
CREATE TABLE exclusion (path BLOB PRIMARY KEY, device INTEGER, inode INTEGER, birth INTEGER);
CREATE TABLE removed (
    number INTEGER PRIMARY KEY AUTOINCREMENT, uuid BLOB NOT NULL UNIQUE, path BLOB, identifier BLOB,
    originalIdentifier BLOB, device INTEGER, inode INTEGER, birth INTEGER);
CREATE INDEX removedPath ON removed (path);
CREATE INDEX removedDirectory ON removed (inode, device);
)";
/// What files of the same version may lack.
constexpr const char* laterSchema = R"(
CREATE TABLE IF NOT EXISTS folder (path BLOB PRIMARY KEY, evidence INTEGER);
CREATE TABLE IF NOT EXISTS handedOver (watch BLOB NOT NULL, places BLOB NOT NULL);
CREATE TRIGGER IF NOT EXISTS applicationRemoved AFTER DELETE ON application BEGIN
    UPDATE folder SET evidence = 0 WHERE evidence <> 0;
END;
)";

// SQLite's integers are signed; the bits are kept.
std::int64_t stored(std::uint64_t value) { return static_cast<std::int64_t>(value); }

void bind(sqlite3_stmt* statement, int place, std::int64_t value) { sqlite3_bind_int64(statement, place, value); }
void bind(sqlite3_stmt* statement, int place, double value) { sqlite3_bind_double(statement, place, value); }
void bind(sqlite3_stmt* statement, int place, const std::string& value) {
    sqlite3_bind_blob64(statement, place, value.data(), value.size(), SQLITE_TRANSIENT);
}
void bind(sqlite3_stmt* statement, int place, const UUID& value) {
    sqlite3_bind_blob64(statement, place, value.bytes.data(), value.bytes.size(), SQLITE_TRANSIENT);
}
template <class T> void bind(sqlite3_stmt* statement, int place, const std::optional<T>& value) {
    if (value) bind(statement, place, *value);
}

/// Faults that are no damage of the file: what it holds may be good again tomorrow.
bool isFaultOfSurroundings(std::int64_t code) {
    switch (code) {
    case SQLITE_PERM:
    case SQLITE_BUSY:
    case SQLITE_LOCKED:
    case SQLITE_NOMEM:
    case SQLITE_READONLY:
    case SQLITE_IOERR:
    case SQLITE_FULL:
    case SQLITE_CANTOPEN:
    case SQLITE_AUTH: return true;
    default: return false;
    }
}

std::optional<std::string> encoded(const std::shared_ptr<const StoredDictionary>& dictionary) {
    return dictionary ? std::optional(dictionary->encoded()) : std::nullopt;
}

} // namespace

void RegistryStore::Close::operator()(sqlite3* database) const { sqlite3_close(database); }
void RegistryStore::Finalize::operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }

/// Reads the columns of one row from left to right.
class RegistryStore::Row {
public:
    explicit Row(sqlite3_stmt* statement) : _statement(statement) {}

    std::int64_t integer() { return sqlite3_column_int64(_statement, _column++); }
    std::uint64_t bits() { return static_cast<std::uint64_t>(integer()); }
    double real() { return sqlite3_column_double(_statement, _column++); }
    /// None for NULL. Good until the next row is read.
    std::optional<std::string_view> bytes() {
        const int column = _column++;
        const void* bytes = sqlite3_column_blob(_statement, column);
        if (bytes != nullptr) {
            const auto size = static_cast<std::size_t>(sqlite3_column_bytes(_statement, column));
            return std::string_view(static_cast<const char*>(bytes), size);
        }
        if (sqlite3_column_type(_statement, column) == SQLITE_NULL) return std::nullopt;
        return std::string_view();
    }
    std::string text() { return std::string(bytes().value_or(std::string_view())); }
    std::optional<std::string> optionalText() {
        const auto text = bytes();
        return text ? std::optional<std::string>(*text) : std::nullopt;
    }
    std::optional<UUID> uuid() {
        const auto bytes = this->bytes().value_or(std::string_view());
        UUID uuid;
        if (bytes.size() != uuid.bytes.size()) return std::nullopt;
        std::memcpy(uuid.bytes.data(), bytes.data(), bytes.size());
        return uuid;
    }
    DirectoryIdentity identity() {
        DirectoryIdentity identity;
        identity.device = bits();
        identity.inode = bits();
        identity.birth = integer();
        return identity;
    }
    BundleFactsRef facts(SharedStrings& strings, StoredDictionary::Keeps keeps) {
        auto facts = std::make_shared<BundleFacts>();
        facts->identity = identity();
        facts->evidence = bits();
        facts->fingerprint = bits();
        facts->hasResources = integer() != 0;
        facts->executable = text();
        facts->info = std::make_shared<const StoredDictionary>(bytes().value_or(std::string_view()), strings, keeps);
        if (const auto entitlements = bytes())
            facts->entitlements = std::make_shared<const StoredDictionary>(*entitlements, strings, keeps);
        return facts;
    }

private:
    sqlite3_stmt* _statement;
    int _column = 0;
};

RegistryStore::RegistryStore(std::string path, SharedStrings& strings) : _path(std::move(path)), _strings(strings) {}
RegistryStore::~RegistryStore() = default;

RegistryStore::Contents RegistryStore::open(std::optional<std::string>& problem) {
    Contents contents;
    auto failure = openFile();
    if (!failure) failure = read(contents);
    if (!failure) return contents;
    problem = failure->text();
    contents = {};
    if (isFaultOfSurroundings(failure->code)) {
        _database.reset();
        return contents;
    }
    moveAside();
    if (openFile()) _database.reset();
    return contents;
}

Failure RegistryStore::openFile() {
    std::error_code ignored; // shows when the file is opened
    std::filesystem::create_directories(std::filesystem::path(_path).parent_path(), ignored);
    // Made here because it must not be readable for others: it holds what the user has installed.
    {
        const Descriptor file(::open(_path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NONBLOCK, 0600));
    }
    sqlite3* database = nullptr;
    const int code = sqlite3_open_v2(_path.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
    _database.reset(database);
    if (code != SQLITE_OK) return lastError();
    sqlite3_busy_timeout(database, busyTimeout);
    if (!execute("PRAGMA journal_mode = WAL") || !execute("PRAGMA synchronous = FULL")) return lastError();
    const Statement version = prepare("PRAGMA user_version");
    if (!version || sqlite3_step(version.get()) != SQLITE_ROW) return lastError();
    const int found = sqlite3_column_int(version.get(), 0);
    if (found == schemaVersion) return execute(laterSchema) ? Failure() : lastError();
    if (found != 0)
        return Error{"SQLite", SQLITE_NOTADB, _path + ": written by another release (" + std::to_string(found) + ")"};
    const bool isMade = execute("BEGIN IMMEDIATE") && execute(schema) && execute(laterSchema) &&
                        execute(("PRAGMA user_version = " + std::to_string(schemaVersion)).c_str()) &&
                        execute("COMMIT");
    return isMade ? Failure() : lastError();
}

Failure RegistryStore::read(Contents& contents) {
    const auto rows = [&](const char* text, auto&& take) {
        const Statement statement = prepare(text);
        if (!statement) return false;
        int code = SQLITE_ROW;
        while ((code = sqlite3_step(statement.get())) == SQLITE_ROW) take(Row(statement.get()));
        return code == SQLITE_DONE;
    };
    const bool isRead =
        rows("SELECT uuid, sequence FROM knowledge",
             [&](Row row) {
                 const auto uuid = row.uuid();
                 if (uuid) contents.knowledge = Knowledge{*uuid, row.bits()};
             }) &&
        readBundles(contents) &&
        rows("SELECT path, evidence FROM folder",
             [&](Row row) {
                 auto path = row.text();
                 contents.listings.emplace(std::move(path), row.bits());
             }) &&
        rows("SELECT watch, places FROM handedOver",
             [&](Row row) {
                 auto watch = row.text();
                 contents.handedOver = HandedOver{std::move(watch), row.text()};
             }) &&
        rows("SELECT path FROM registration", [&](Row row) { contents.registrations.insert(row.text()); }) &&
        rows("SELECT path, device, inode, birth FROM exclusion", [&](Row row) {
            auto path = row.text();
            contents.exclusions.emplace(std::move(path), row.identity());
        });
    return isRead ? Failure() : lastError();
}

/// Applications and plug-ins in the order of their rows, which is nearly that of the paths: so most go to the end of
/// their map, and a plug-in's application is mostly the one that was read last. (The order of the paths would take a
/// look-up of each row by its index.)
bool RegistryStore::readBundles(Contents& contents) {
    std::error_code ignored; // then there is little to read, or nothing
    const auto size = std::filesystem::file_size(_path, ignored);
    const HeapGrowth growth(ignored ? 0 : size + size / 2); // about what the records take up
    const Statement applications =
        prepare("SELECT path, device, inode, birth, evidence, fingerprint, resources, executable, info, entitlements "
                "FROM application");
    const Statement plugIns =
        prepare("SELECT path, device, inode, birth, evidence, fingerprint, resources, executable, info, entitlements, "
                "uuid, identifier, originalIdentifier, registered, application FROM plugIn");
    if (!applications || !plugIns) return false;
    Installed inOrder;
    bool isInOrder = true;
    const auto add = [&](auto& map, auto& list, auto record) {
        if (!list.empty() && list.back()->path >= record->path) isInOrder = false;
        map.emplace_hint(map.end(), record->path, record);
        list.push_back(std::move(record));
    };
    int applicationCode = SQLITE_ROW;
    const auto nextApplication = [&] {
        // Past its end a statement would begin anew.
        if (applicationCode == SQLITE_ROW) applicationCode = sqlite3_step(applications.get());
        if (applicationCode != SQLITE_ROW) return false;
        Row row(applications.get());
        auto application = std::make_shared<InstalledApplication>();
        application->path = row.text();
        application->facts = row.facts(_strings, StoredDictionary::Keeps::encoding);
        add(contents.applications, inOrder.applications, std::move(application));
        return true;
    };
    const auto applicationAt = [&](std::string_view path) -> InstalledApplicationRef {
        const auto isLast = [&] { return !inOrder.applications.empty() && inOrder.applications.back()->path == path; };
        if (isLast() || (nextApplication() && isLast())) return inOrder.applications.back();
        const auto found = contents.applications.find(std::string(path));
        if (found != contents.applications.end()) return found->second;
        while (nextApplication()) {
            if (isLast()) return inOrder.applications.back();
        }
        return nullptr;
    };
    int code = SQLITE_ROW;
    while ((code = sqlite3_step(plugIns.get())) == SQLITE_ROW) {
        Row row(plugIns.get());
        auto plugIn = std::make_shared<InstalledPlugIn>();
        plugIn->path = row.text();
        plugIn->facts = row.facts(_strings, StoredDictionary::Keeps::whatWasAskedFor);
        const auto uuid = row.uuid();
        plugIn->identifier = row.optionalText();
        plugIn->originalIdentifier = row.optionalText();
        plugIn->registered = Date{row.real()};
        if (const auto path = row.bytes()) {
            plugIn->application = applicationAt(*path);
            // Without its application the row tells nothing; the scan reads the bundle again.
            if (!plugIn->application) continue;
        }
        if (!uuid) continue;
        plugIn->uuid = *uuid;
        add(contents.plugIns, inOrder.plugIns, std::move(plugIn));
    }
    while (applicationCode == SQLITE_ROW) nextApplication();
    if (isInOrder) contents.inOrder = std::move(inOrder);
    return code == SQLITE_DONE && applicationCode == SQLITE_DONE;
}

void RegistryStore::moveAside() {
    _database.reset();
    const std::string damaged = _path + ".damaged";
    std::error_code ignored; // an old damaged file that cannot be replaced shows when the new one is opened
    std::filesystem::remove_all(damaged, ignored);
    std::filesystem::rename(_path, damaged, ignored);
    for (const char* suffix : {"-wal", "-shm"}) std::filesystem::remove(_path + suffix, ignored);
}

Failure RegistryStore::begin() {
    if (!_database) return Error{"SQLite", SQLITE_CANTOPEN, _path + ": not open"};
    _failure.reset();
    if (!execute("BEGIN IMMEDIATE")) return lastError();
    return std::nullopt;
}

Failure RegistryStore::end() {
    if (!_failure && !execute("COMMIT")) _failure = lastError();
    if (_failure) execute("ROLLBACK");
    return std::exchange(_failure, std::nullopt);
}

bool RegistryStore::execute(const char* text) {
    return sqlite3_exec(_database.get(), text, nullptr, nullptr, nullptr) == SQLITE_OK;
}

RegistryStore::Statement RegistryStore::prepare(const char* text) {
    sqlite3_stmt* statement = nullptr;
    sqlite3_prepare_v2(_database.get(), text, -1, &statement, nullptr);
    return Statement(statement);
}

template <class... Values> void RegistryStore::run(const char* text, const Values&... values) {
    if (_failure) return;
    const Statement statement = prepare(text);
    if (statement) {
        int place = 0;
        (bind(statement.get(), ++place, values), ...);
        if (sqlite3_step(statement.get()) == SQLITE_DONE) return;
    }
    _failure = lastError();
}

Error RegistryStore::lastError() const {
    const char* text = _database ? sqlite3_errmsg(_database.get()) : "out of memory";
    return {"SQLite", _database ? sqlite3_errcode(_database.get()) : SQLITE_NOMEM, _path + ": " + text};
}

void RegistryStore::setKnowledge(const Knowledge& knowledge) {
    run("DELETE FROM knowledge");
    run("INSERT INTO knowledge VALUES (?, ?)", knowledge.uuid, stored(knowledge.sequence));
}

void RegistryStore::put(const InstalledApplication& application) {
    const auto& facts = *application.facts;
    run("INSERT OR REPLACE INTO application VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?)", application.path,
        stored(facts.identity.device), stored(facts.identity.inode), facts.identity.birth, stored(facts.evidence),
        stored(facts.fingerprint), std::int64_t{facts.hasResources}, facts.executable, encoded(facts.info),
        encoded(facts.entitlements));
}

void RegistryStore::removeApplication(const std::string& path) { run("DELETE FROM application WHERE path = ?", path); }

void RegistryStore::put(const InstalledPlugIn& plugIn) {
    const auto& facts = *plugIn.facts;
    run("INSERT OR REPLACE INTO plugIn VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?)", plugIn.path,
        stored(facts.identity.device), stored(facts.identity.inode), facts.identity.birth, stored(facts.evidence),
        stored(facts.fingerprint), std::int64_t{facts.hasResources}, facts.executable, encoded(facts.info),
        encoded(facts.entitlements), plugIn.uuid, plugIn.identifier, plugIn.originalIdentifier,
        plugIn.registered.seconds,
        plugIn.application ? std::optional(plugIn.application->path) : std::optional<std::string>());
}

void RegistryStore::removePlugIn(const std::string& path) { run("DELETE FROM plugIn WHERE path = ?", path); }

void RegistryStore::setRegistered(const std::string& path, bool isRegistered) {
    run(isRegistered ? "INSERT OR REPLACE INTO registration VALUES (?)" : "DELETE FROM registration WHERE path = ?",
        path);
}

void RegistryStore::setExcluded(const std::string& path, const std::optional<DirectoryIdentity>& identity) {
    if (!identity) return run("DELETE FROM exclusion WHERE path = ?", path);
    run("INSERT OR REPLACE INTO exclusion VALUES (?, ?, ?, ?)", path, stored(identity->device), stored(identity->inode),
        identity->birth);
}

void RegistryStore::setListing(const std::string& path, const std::optional<std::uint64_t>& evidence) {
    if (!evidence) return run("DELETE FROM folder WHERE path = ?", path);
    run("INSERT OR REPLACE INTO folder VALUES (?, ?)", path, stored(*evidence));
}

void RegistryStore::setHandedOver(const std::optional<HandedOver>& handedOver) {
    run("DELETE FROM handedOver");
    if (handedOver) run("INSERT INTO handedOver VALUES (?, ?)", handedOver->watch, handedOver->places);
}

void RegistryStore::remember(const RemovedPlugIn& removed) {
    run("INSERT OR REPLACE INTO removed (uuid, path, identifier, originalIdentifier, device, inode, birth) "
        "VALUES (?, ?, ?, ?, ?, ?, ?)",
        removed.uuid, removed.path, removed.identifier, removed.originalIdentifier, stored(removed.identity.device),
        stored(removed.identity.inode), removed.identity.birth);
}

void RegistryStore::forget(const UUID& removed) { run("DELETE FROM removed WHERE uuid = ?", removed); }

void RegistryStore::keepRemoved(std::size_t count) {
    run("DELETE FROM removed WHERE number <= (SELECT max(number) FROM removed) - ?", static_cast<std::int64_t>(count));
}

std::vector<RemovedPlugIn> RegistryStore::removedPlugIns(const DirectoryIdentity& identity, const std::string& path) {
    std::vector<RemovedPlugIn> found;
    if (!_database) return found;
    const Statement statement =
        prepare("SELECT uuid, path, identifier, originalIdentifier, device, inode, birth FROM removed "
                "WHERE (inode = ? AND device = ? AND birth = ?) OR path = ? ORDER BY number DESC");
    if (!statement) return found;
    bind(statement.get(), 1, stored(identity.inode));
    bind(statement.get(), 2, stored(identity.device));
    bind(statement.get(), 3, identity.birth);
    bind(statement.get(), 4, path);
    while (sqlite3_step(statement.get()) == SQLITE_ROW) {
        Row row(statement.get());
        RemovedPlugIn removed;
        const auto uuid = row.uuid();
        removed.path = row.text();
        removed.identifier = row.optionalText();
        removed.originalIdentifier = row.optionalText();
        removed.identity = row.identity();
        if (!uuid) continue;
        removed.uuid = *uuid;
        found.push_back(std::move(removed));
    }
    return found;
}

} // namespace platform::linux_

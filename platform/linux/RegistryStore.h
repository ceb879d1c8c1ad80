#pragma once

#include "platform/Error.h"
#include "platform/linux/RegistryRecord.h"

#include <cstddef>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

struct sqlite3;
struct sqlite3_stmt;

namespace platform::linux_ {

/// What the registry must know again after a restart, in one SQLite file. For one thread at a time.
class RegistryStore {
public:
    struct Contents {
        std::optional<Knowledge> knowledge;
        Applications applications;
        PlugIns plugIns;
        std::optional<Installed> inOrder; // the same, if it was read in the order of the paths, as it mostly is
        std::set<std::string> registrations;
        Exclusions exclusions;
        Listings listings;
        std::optional<HandedOver> handedOver;
    };

    RegistryStore(std::string path, SharedStrings& strings);
    ~RegistryStore();
    RegistryStore(const RegistryStore&) = delete;
    RegistryStore& operator=(const RegistryStore&) = delete;

    /// Opens the file and reads everything, making what is missing. A file that is no such database, or a damaged
    /// one, is moved aside under a name that tells so, and the contents are empty. `problem` is set when something
    /// was wrong. Where no file can be had at all the store keeps nothing, and every change fails.
    Contents open(std::optional<std::string>& problem);

    /// Runs `changes` as one transaction: all of it is kept or nothing.
    template <class F> Failure change(F&& changes) {
        if (auto failure = begin()) return failure;
        changes();
        return end();
    }

    // Within `change`. The first failure is what `change` answers; what follows it does nothing.
    void setKnowledge(const Knowledge& knowledge);
    void put(const InstalledApplication& application);
    void removeApplication(const std::string& path);
    void put(const InstalledPlugIn& plugIn);
    void removePlugIn(const std::string& path);
    void setRegistered(const std::string& path, bool isRegistered);
    void setExcluded(const std::string& path, const std::optional<DirectoryIdentity>& identity);
    /// None takes it out. (Each application that is removed sets all to 0, for of its return they would not tell.)
    void setListing(const std::string& path, const std::optional<std::uint64_t>& evidence);
    void setHandedOver(const std::optional<HandedOver>& handedOver);
    void remember(const RemovedPlugIn& removed);
    void forget(const UUID& removed);
    /// Forgets the oldest of the removed plug-ins but for `count`.
    void keepRemoved(std::size_t count);

    /// The removed plug-ins with this directory or this path.
    std::vector<RemovedPlugIn> removedPlugIns(const DirectoryIdentity& identity, const std::string& path);

private:
    class Row;
    struct Close {
        void operator()(sqlite3* database) const;
    };
    struct Finalize {
        void operator()(sqlite3_stmt* statement) const;
    };
    using Statement = std::unique_ptr<sqlite3_stmt, Finalize>;

    Failure openFile();
    Failure read(Contents& contents);
    bool readBundles(Contents& contents);
    void moveAside();
    Failure begin();
    Failure end();
    bool execute(const char* text);
    Statement prepare(const char* text);
    template <class... Values> void run(const char* text, const Values&... values);
    Error lastError() const;

    const std::string _path;
    SharedStrings& _strings;
    std::unique_ptr<sqlite3, Close> _database;
    Failure _failure; // the first one of the transaction under way
};

} // namespace platform::linux_

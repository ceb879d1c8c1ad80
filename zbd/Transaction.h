#pragma once

#include "Zembra/ZBProtocol.h"
#include "platform/Transport.h"
#include "zbd/ZBDatabase.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zbd {

class ZBDQmxClient;
class ZBDServer;

/// One request being served, answered exactly once. Made where the message arrived; everything else runs on the
/// service queue, but for replies that wait for an event elsewhere. Lives until no work item or callback refers to it.
class Transaction final : public std::enable_shared_from_this<Transaction> {
public:
    /// Called with a path and whether it was resolved to a real one. False stops the walk; the callback has answered.
    using PathCallback = std::function<bool(const std::string& path, bool resolved)>;
    /// False stops the walk; the callback has answered.
    using PlugInCallback = std::function<bool(const ZBDPlugInRef& plugIn)>;

    /// `message` holds a dictionary. Prepares the reply.
    static std::shared_ptr<Transaction> initWithRequest(const platform::ReceivedMessage& message,
                                                        std::shared_ptr<ZBDQmxClient> client);

    /// Whether serving it now, when its turn on the service queue has come, is a matter of microseconds.
    bool isBrief() const;

    /// Checks version and liveness, then calls the handler of the request's type. A request of a dead client is
    /// dropped, unless its version already refused it.
    void dispatch();

    // The walks over a request's plug-in list. One that returns false has answered.
    bool marshalPaths(const PathCallback& callback);
    bool processUuidList(const PlugInCallback& callback);
    /// As `marshalPaths`, and then sends the success reply.
    bool processPaths(const PathCallback& callback);

    /// Sends the reply as it stands. The reply is not touched afterwards.
    void done();
    void fail(std::uint64_t errorCode, std::string_view message);
    /// An error of the system's own domain travels with its own code and text.
    void fail(std::uint64_t errorCode, const platform::Error& error);

    // Handlers.
    void addPlugIns();          // TransactionRegistration.cpp
    void removePlugIns();       // TransactionRegistration.cpp
    void bulkPlugIns();         // TransactionRegistration.cpp
    void matchPlugIns();        // TransactionDiscovery.cpp
    void readyPlugIns();        // TransactionActivation.cpp
    void accessPlugIns();       // TransactionActivation.cpp
    void annotatePlugIns();     // TransactionAnnotations.cpp
    void bulkAnnotatePlugIns(); // TransactionAnnotations.cpp
    void lockDownPlugIns();     // TransactionHolds.cpp
    void findPlugIn();          // TransactionFind.cpp

    /// Sets the form's "annotations" to what is stored for the plug-in, or to an empty dictionary.
    void addAnnotationForPlugIn(const ZBDPlugIn& plugIn, platform::MutableDictionary& form);

    const std::shared_ptr<ZBDQmxClient>& client() const { return _client; }
    const platform::Dictionary& request() const { return _request; }
    platform::MutableDictionary& reply() { return _reply.content; }
    std::uint64_t version() const { return _version; }
    const std::shared_ptr<ZBDServer>& server() const;
    /// Null when the connection is gone.
    std::shared_ptr<platform::Connection> connection() const;

private:
    Transaction(const platform::ReceivedMessage& message, std::shared_ptr<ZBDQmxClient> client);
    ZBDPlugInRef findPlugInByUUID(const platform::UUID& uuid);
    ZBDPlugInRef findPlugInByPathURL(std::string_view text);
    ZBDPlugIns preferBundleRelativeForHost(const ZBDPlugIns& candidates);
    /// Whether a form of that kept one has the annotations and tokens that it would get `now`.
    bool isComplete(const ZBDPlugIn& plugIn, const KeptForm& kept, std::chrono::steady_clock::time_point now) const;
    /// Sets the annotations and tokens of a form that `currentForm` made, unless it is complete.
    void completeForm(const ZBDPlugIn& plugIn, platform::MutableDictionary& form, const KeptFormRef& kept,
                      std::chrono::steady_clock::time_point now);
    void releaseHolds(const platform::Array& tokens);
    bool collectPlugInsToHold(std::uint64_t flags, std::vector<ZBDPlugInRef>& plugIns);
    bool mayRegister(const platform::URL& url) const;
    std::optional<std::string> realPath(const std::string& path) const;
    /// The lists of a request that names plug-ins by UUID.
    struct UuidList {
        platform::Array uuids;
        std::optional<platform::Array> paths; // as many, for UUIDs that nobody knows
    };
    std::optional<UuidList> uuidList();
    ZBDPlugInRef plugInOfList(const UuidList& list, std::size_t index);
    bool annotateInBulk(const platform::Dictionary::Entry& entry);
    void finishAnnotating();
    void saveChanges();

    std::shared_ptr<ZBDQmxClient> _client;
    platform::Dictionary _request;
    platform::ReplyMessage _reply;
    std::uint64_t _version = 0;
    std::vector<AnnotationChange> _changes; // not yet saved; they are before anything is answered
};

} // namespace zbd

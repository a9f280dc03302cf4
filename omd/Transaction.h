// One request from arrival to its one reply. Made on the connection's delivery thread, dispatched
// on the server's "service" queue, answered by done() or fail() exactly once, from whichever
// queue the handler finishes on.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Conduit.h"
#include "platform/OMError.h"
#include "platform/Value.h"

namespace om {

class OMDConduitClient;
class OMDPlugIn;
class OMDServer;

// Protocol versions a request may carry.
inline constexpr uint64_t kOMProtocolVersionCurrent = 3;
inline constexpr uint64_t kOMProtocolVersionOldest = 2;

// Typed getters for request dictionaries: the value of key when it has the named kind, else none.
std::optional<Value> conduit_dictionary_get_array(const Value& dictionary, std::string_view key);
std::optional<Value> conduit_dictionary_get_dictionary(const Value& dictionary, std::string_view key);

class Transaction : public std::enable_shared_from_this<Transaction> {
public:
    // request is the message as received: its id binds the reply to it. A dictionary sent without
    // awaiting a reply (id 0) is dispatched like any other, so that a fire-and-forget request
    // still takes effect; done() then has nowhere to send the reply and drops it.
    Transaction(const ConduitEvent& request, std::shared_ptr<OMDConduitClient> client);
    ~Transaction();

    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;

    void dispatch();
    void done();
    // message none leaves "error" unset.
    void fail(int64_t code, std::optional<std::string_view> message);
    // An error of the daemon's own domain keeps its own code; a foreign one is reported with code.
    void fail(int64_t code, const OMError& error);

    const std::shared_ptr<OMDConduitClient>& client() const { return m_client; }
    const Value& request() const { return m_request; }
    uint64_t requestId() const { return m_requestId; }
    // The reply being filled; sent by done().
    DictionaryBuilder& reply() { return m_reply; }
    uint64_t version() const { return m_version; }
    void setVersion(uint64_t version) { m_version = version; }
    bool replied() const { return m_replied; }

    // Called once per path of "paths" with the canonical path (resolved) or the path as sent (not
    // resolved). Answers true to go on; false once it has ended the request with fail().
    using PathHandler = std::function<bool(const std::string& path, bool resolved)>;
    // Called once per plug-in named by "uuids"; same contract.
    using PlugInHandler = std::function<bool(const std::shared_ptr<OMDPlugIn>& plugIn)>;

    // Walks "paths" (TransactionRegistration.cpp). False after a failure, already reported.
    bool marshalPaths(const PathHandler& handler);
    // marshalPaths, then done() when every path was handled.
    bool processPaths(const PathHandler& handler);
    // Walks "uuids", looking each plug-in up. False after a failure, already reported; never
    // ends the request on success.
    bool processUuidList(const PlugInHandler& handler);

    // Sets the form's "annotations" to the plug-in's stored annotation, or an empty dictionary.
    void addAnnotationForPlugIn(const OMDPlugIn& plugIn, DictionaryBuilder& form);

    const std::shared_ptr<OMDServer>& server() const;
    // Null once the peer's connection object is gone.
    std::shared_ptr<ConduitConnection> connection() const;

private:
    // Runs the handler named by the request, or answers that there is none (TransactionDispatch.cpp).
    void runHandler(const std::string& name);

    // Discovery's visibility rules for this client (TransactionMatch.cpp).
    bool visibleToClient(const std::shared_ptr<OMDPlugIn>& plugIn, uint64_t flags) const;
    // Yes when one of the user's exclusions removes the plug-in.
    bool excluded(const OMDPlugIn& plugIn, const Value& exclusions) const;

    // Request handlers, one per row of the dispatch table. Each finishes with done() or fail().
    void addPlugIns();
    void removePlugIns();
    void bulkPlugIns();
    void matchPlugIns();
    void readyPlugIns();
    void accessPlugIns();
    void annotatePlugIns();
    void bulkAnnotatePlugIns();
    void lockDownPlugIns();

    std::shared_ptr<OMDConduitClient> m_client;
    Value m_request;
    uint64_t m_requestId;
    DictionaryBuilder m_reply;
    uint64_t m_version = 0;
    bool m_replied = false;
};

} // namespace om

// OMDaemonClient: one connection to omd, one method per request. Each method builds the request
// dictionary in the daemon's wire format and hands the raw reply (the reply dictionary or a
// transport error) to the caller's block on the client's serial reply queue; errorInReply turns
// such a reply into an error value.
//
// Nothing is retried: once the connection has failed, every further request is answered with a
// transport error. Destroying the client closes its connection; requests still outstanding then
// complete with a transport error.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Ombrel/OMPlugInCore.h"
#include "platform/Conduit.h"
#include "platform/OMError.h"
#include "platform/Result.h"
#include "platform/Uuid.h"
#include "platform/Value.h"
#include "platform/WorkQueue.h"

namespace om {

class OMDaemonClient {
public:
    // Receives the daemon's reply dictionary, or the transport's error when there is none.
    using ReplyBlock = std::function<void(const Result<Value>&)>;

    static constexpr const char* kDefaultServiceName = "com.orvex.ombrel.omd";
    static constexpr int64_t kCurrentProtocolVersion = 3;

    // Discovery flags of matchPlugIns. OMDiscoverAll is honoured only for an unsandboxed client
    // holding "com.orvex.private.ombrel.manager".
    static constexpr uint64_t OMDiscoverAllVersions = 0x1;
    static constexpr uint64_t OMDiscoverSameVersions = 0x4; // with OMDiscoverAllVersions
    static constexpr uint64_t OMDiscoverSystemOnly = 0x8;
    static constexpr uint64_t OMDiscoverAll = 0x200;

    // Flags of holdPlugins. Without OMLockFlagPlugInPaths each path names an application and all
    // of its plug-ins are held.
    static constexpr uint64_t OMLockFlagPlugInPaths = 0x1;
    static constexpr uint64_t OMLockFlagCheckBusy = 0x2; // refuse the hold when one is busy
    static constexpr uint64_t OMLockFlagTerminate = 0x4; // stop running instances before the reply

    // Connects to the named service (the daemon's default name when null). Connecting cannot fail
    // here: an unreachable service shows up as a transport error in the first reply.
    static std::shared_ptr<OMDaemonClient> initWithServiceName(const char* name);
    ~OMDaemonClient();

    OMDaemonClient(const OMDaemonClient&) = delete;
    OMDaemonClient& operator=(const OMDaemonClient&) = delete;

    const std::shared_ptr<ConduitConnection>& omd() const { return m_omd; }
    const std::shared_ptr<WorkQueue>& replyQueue() const { return m_replyQueue; }
    int64_t protocolVersion() const { return m_protocolVersion; }
    void setProtocolVersion(int64_t version) { m_protocolVersion = version; }

    // Path lists are value-tree arrays of strings; UUIDs travel in the order given.
    void addPlugIns(const Value& paths, ReplyBlock reply);
    void removePlugIns(const Value& paths, ReplyBlock reply);
    void bulkPlugins(uint64_t flags, ReplyBlock reply);
    void readyPlugIns(const std::vector<Uuid>& uuids, uint64_t flags, ReplyBlock reply);
    void accessPlugIns(const std::vector<Uuid>& uuids, uint64_t flags, ReplyBlock reply);
    // rules none: no "rules" key, which the daemon reads as every installed plug-in.
    void matchPlugIns(const Value& rules, uint64_t flags, ReplyBlock reply);
    void setPluginAnnotations(const std::vector<Uuid>& uuids, const Value& annotations, ReplyBlock reply);
    void bulkSetPluginAnnotations(const Value& annotations, ReplyBlock reply);
    void holdPlugins(const Value& paths, uint64_t flags, ReplyBlock reply);
    void releaseHold(const Uuid& token, ReplyBlock reply);

    // None for a success reply. A transport error becomes code 4 with the transport's description.
    // A reply with a message but no code is a protocol violation and ends the process.
    static std::optional<OMError> errorInReply(const Result<Value>& reply);

    // A new request: "request" = name, "version" = protocolVersion.
    DictionaryBuilder request(std::string_view name) const;
    // request(name) plus "paths".
    DictionaryBuilder request(std::string_view name, const Value& paths) const;
    // Sets "uuids" to an array of UUID values in the order given.
    static void set(DictionaryBuilder& request, const std::vector<Uuid>& uuids);
    void send(const Value& request, ReplyBlock reply);

    // The whole tree as one transport value; only protocol version 3 has such an encoding.
    static std::optional<Value> convertToConduit(const Value& tree, int64_t version);
    std::optional<Value> convertFromConduit(const Value& message) const;

    // One plug-in of a "match" reply: the record rebuilt from its form, and what the daemon adds
    // to a form beyond what the record keeps.
    struct MatchedPlugIn {
        std::shared_ptr<OMPlugInCore> plugIn;
        Value form; // as it arrived
        // "extensions": resource name ("." for the whole bundle) to sandbox-extension token; empty
        // when the plug-in shares nothing.
        std::vector<std::pair<std::string, std::string>> resourceTokens;
        std::optional<std::string> overrider; // UUID text of the returned plug-in that replaces this one
        std::optional<std::string> overriding; // identifier of the plug-in this one replaces

        // The stored election, as the daemon keeps it ("annotations" "election"); none when the user
        // never made one.
        Value election() const;
        // Whether the election enables the plug-in, judged as discovery judges it: its low 8 bits.
        bool elected() const;
        // The values hosts keep about the plug-in ("annotations" "extension"), or none.
        Value extension() const;
        std::optional<std::string> resourceToken(std::string_view resource) const;
    };
    // A form that did not become a record, and why.
    struct SkippedForm {
        size_t index; // in the reply's array
        std::string reason;
    };
    struct MatchReply {
        Value reply; // the daemon's reply dictionary as it came
        std::vector<MatchedPlugIn> matches; // in the reply's order
        std::vector<SkippedForm> skipped;
    };
    // Reads the reply of matchPlugIns. An error reply (errorInReply) is that error; a "matches"
    // that does not decode to an array is an error of code 4. A success without "matches" has
    // none. Forms that are not dictionaries or that initWithForm refuses are skipped and listed.
    Result<MatchReply> matchesInReply(const Result<Value>& reply) const;
    // matchPlugIns, waited for, then matchesInReply.
    Result<MatchReply> matchPlugInsSync(const Value& rules, uint64_t flags);

    // Blocking forms for tools and tests. They wait on the reply queue's work, so calling them
    // from a reply block (on the reply queue) would deadlock; that is an internal-consistency
    // failure. waitForReply runs start with a block and returns what that block receives.
    Result<Value> sendSync(const Value& request);
    Result<Value> waitForReply(const std::function<void(ReplyBlock)>& start);

private:
    OMDaemonClient(std::shared_ptr<WorkQueue> replyQueue, std::shared_ptr<ConduitConnection> omd);

    std::shared_ptr<WorkQueue> m_replyQueue;
    std::shared_ptr<ConduitConnection> m_omd;
    int64_t m_protocolVersion = kCurrentProtocolVersion;
    // Set just before our own cancel, so that the event handler stays quiet about it.
    std::shared_ptr<std::atomic<bool>> m_closing;
};

} // namespace om

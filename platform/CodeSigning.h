// CodeSigningTask: the entitlements of a peer process, read once when the task is made.
//
// Entitlements are a vlist dictionary (either form) in the ELF section ".entitlements" of the
// peer's executable, which scripts/entitle writes. The executable is opened through the peer's
// /proc entry, so what is read is the image that actually runs. They count only when that file
// is owned by root or by our own effective user and is writable by neither group nor others:
// anyone else could have given themselves any entitlement.
#pragma once

#include <sys/stat.h>

#include <memory>
#include <optional>
#include <string_view>

#include "platform/OMError.h"
#include "platform/Process.h"
#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class CodeSigningTask {
public:
    // Null when the process cannot be examined (it is gone, or its pid now names another one).
    static std::shared_ptr<CodeSigningTask> create(const AuditToken& token);

    // The entitlement's value, or none when it is not held. An error when the executable has an
    // entitlements section that does not parse (the caller decides what to log).
    Result<Value> entitlementValue(std::string_view key) const;
    // The whole dictionary; none when there are no entitlements, or they did not parse.
    const Value& entitlements() const { return m_entitlements; }
    // Whether the executable's owner and mode let its entitlements count.
    bool trusted() const { return m_trusted; }

    // The entitlements section of the ELF file open at fd: none when the file is not a 64-bit ELF
    // file of this machine's byte order or has no such section; a dictionary otherwise. Every
    // offset and size in the file is checked against the file's size before it is used.
    static Result<Value> readEntitlements(int fd);
    // Whether a file with this status may grant entitlements: a regular file owned by root or by
    // our effective user, writable by neither group nor others.
    static bool ownerMayGrant(const struct stat& info);

private:
    CodeSigningTask(bool trusted, Value entitlements, std::optional<OMError> error);

    bool m_trusted;
    Value m_entitlements;
    std::optional<OMError> m_error; // the section exists but does not parse
};

} // namespace om

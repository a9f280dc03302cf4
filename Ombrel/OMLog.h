// The daemon's log handles: subsystem "com.orvex.Ombrel", one category per concern. All four are
// made together on first use of any and kept for the life of the process.
#pragma once

#include <array>
#include <functional>
#include <memory>
#include <string>

#include "platform/Log.h"

namespace om {

class OMLog {
public:
    static const Log& ops(); // everything not listed below
    static const Log& traffic(); // the client library's request and reply traces
    static const Log& extension(); // attribute-matching traces
    static const Log& rg(); // registrar traces

    enum class Category : uint8_t { Ops, Traffic, Extension, Rg };
    using Factory = std::function<Result<std::shared_ptr<Log>>(std::string subsystem, std::string category)>;

    // Makes a set of handles with the given factory; the shared set uses Log::create. A category
    // the factory refuses falls back to the default handle, and the refusal is logged there.
    explicit OMLog(const Factory& factory);
    const Log& handle(Category category) const { return *m_handles[static_cast<size_t>(category)]; }

private:
    static const OMLog& shared();

    std::array<std::shared_ptr<Log>, 4> m_owned;
    std::array<const Log*, 4> m_handles {};
};

} // namespace om

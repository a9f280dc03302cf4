#include "tools/omctl/OmctlDiagnostics.h"

#include <charconv>
#include <chrono>
#include <cstdio>
#include <istream>
#include <optional>
#include <ostream>

#include "platform/ValueTreeConversion.h"
#include "platform/Vlist.h"
#include "tools/omctl/OmctlJson.h"

namespace om {

const char* const OmctlDiagnostics::kRawHelp = R"(usage: omctl [--service NAME] [--json] raw (--file FILE | JSON | -)

Sends one request dictionary to omd and prints the reply as it came back.

The request is a vlist file (XML or binary form), JSON text, or JSON text read
from standard input ("-"), for example
  omctl raw '{"request": "match", "version": 3, "flags": 0}'
JSON objects become dictionaries in their key order; integers become signed
64-bit integers, or unsigned ones above 9223372036854775807; numbers with a
fraction or an exponent become reals; null is refused. The kinds JSON lacks
are written as an object with one marker key:
  {"$uuid": "6BA7B810-9DAD-11D1-80B4-00C04FD430C8"}      a UUID
  {"$data": "AAEC/w=="}                                  bytes, in base64
  {"$date": "2026-11-22T10:00:00Z"} or {"$date": 1795341600}  a date (UTC)
  {"$real": "nan"}, "inf", "-inf" or a number            a real
--json prints the reply in the same notation.

Options:
  -f, --file FILE   read the request from a vlist file
)";

const char* const OmctlDiagnostics::kPingHelp = R"(usage: omctl [--service NAME] [--json] ping [--count N]

Sends a request that omd does not recognise and reports whether the daemon
answers, with the round-trip time of each request. The first request also
pays for connecting.

Options:
  -c, --count N     send N requests, one after the other (1 to 10000; default 1)
)";

namespace {

// Takes the value of an option given as "--name VALUE" or "--name=VALUE".
std::optional<std::string> optionValue(const std::vector<std::string>& arguments, size_t& index,
    std::string_view longName, std::string_view shortName, bool& matched)
{
    const std::string& argument = arguments[index];
    matched = false;
    if (argument == longName || argument == shortName) {
        matched = true;
        if (index + 1 >= arguments.size())
            return std::nullopt;
        return arguments[++index];
    }
    if (argument.size() > longName.size() && argument.starts_with(longName) && argument[longName.size()] == '=') {
        matched = true;
        return argument.substr(longName.size() + 1);
    }
    return std::nullopt;
}

bool isOption(const std::string& argument)
{
    return argument.size() > 1 && argument[0] == '-';
}

} // namespace

int OmctlDiagnostics::raw(OmctlContext& context, const std::vector<std::string>& arguments)
{
    std::optional<std::string> file;
    std::vector<std::string> texts;
    bool optionsEnded = false;
    for (size_t index = 0; index < arguments.size(); ++index) {
        bool matched = false;
        auto value = optionsEnded ? std::nullopt : optionValue(arguments, index, "--file", "-f", matched);
        if (!optionsEnded && matched) {
            if (!value)
                return context.usage("raw: --file needs a file name");
            file = std::move(value);
        } else if (!optionsEnded && arguments[index] == "--") {
            optionsEnded = true;
        } else if (!optionsEnded && isOption(arguments[index])) {
            return context.usage("raw: unknown option " + arguments[index]);
        } else {
            texts.push_back(arguments[index]);
        }
    }
    if (texts.size() + (file ? 1 : 0) != 1)
        return context.usage("raw: give exactly one request: --file FILE or JSON text");

    Result<Value> request = OMError("omctl", 0);
    if (file) {
        request = Vlist::readFile(*file);
    } else if (texts.front() == "-") {
        // One byte past the parser's limit is enough for it to refuse the text as too long.
        std::string text(OmctlJson::kMaxInputBytes + 1, '\0');
        context.in().read(text.data(), static_cast<std::streamsize>(text.size()));
        text.resize(static_cast<size_t>(context.in().gcount()));
        request = OmctlJson::parse(text);
    } else {
        request = OmctlJson::parse(texts.front());
    }
    if (!request.ok()) {
        return context.usage(
            "raw: " + (file ? *file : std::string("JSON request")) + ": " + request.error().localizedDescription());
    }
    if (!request->isDictionary())
        return context.usage("raw: the request must be a dictionary");
    if (!ValueTreeConversion::toConduit(*request))
        return context.usage("raw: the request cannot be carried to omd (nested too deeply)");

    Result<Value> reply = context.client().sendSync(*request);
    if (reply.ok())
        context.print(reply.value());
    return context.outcome(reply);
}

int OmctlDiagnostics::ping(OmctlContext& context, const std::vector<std::string>& arguments)
{
    unsigned count = 1;
    for (size_t index = 0; index < arguments.size(); ++index) {
        bool matched = false;
        auto value = optionValue(arguments, index, "--count", "-c", matched);
        if (!matched)
            return context.usage("ping: unexpected argument " + arguments[index]);
        const char* end = value ? value->data() + value->size() : nullptr;
        auto parsed = value ? std::from_chars(value->data(), end, count) : std::from_chars_result {};
        if (!value || parsed.ec != std::errc() || parsed.ptr != end || count < 1 || count > 10000)
            return context.usage("ping: --count needs a number from 1 to 10000");
    }

    OMDaemonClient& client = context.client();
    // Any name outside the daemon's table: answered at once, without handler work.
    Value request = client.request("ping").build();
    ArrayBuilder times;
    for (unsigned i = 0; i < count; ++i) {
        auto start = std::chrono::steady_clock::now();
        Result<Value> reply = client.sendSync(request);
        std::chrono::duration<double, std::milli> elapsed = std::chrono::steady_clock::now() - start;
        if (!reply.ok())
            return context.outcome(reply);
        times.append(Value::real(elapsed.count()));
        if (!context.json()) {
            char line[64];
            (void)std::snprintf(line, sizeof line, "%.3f ms", elapsed.count());
            context.out() << "omd at " << context.socketPath() << " is answering (round trip " << line << ")\n";
        }
    }
    if (context.json()) {
        context.print(Value::dictionary({
            { "service", Value::string(context.service()) },
            { "socket", Value::string(context.socketPath()) },
            { "roundTripMilliseconds", times.build() },
        }));
    }
    return kOmctlSuccess;
}

} // namespace om

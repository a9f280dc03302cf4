// OMDaemonClient: reading a "match" reply into plug-in records.
#include "Ombrel/OMDaemonClient.h"
#include "Ombrel/OMMakeError.h"
#include "Ombrel/OMMatcher.h"
#include "platform/Format.h"

namespace om {

namespace {

std::optional<std::string> textFor(const Value& form, std::string_view key)
{
    const std::string* text = form.stringFor(key);
    return text ? std::optional<std::string>(*text) : std::nullopt;
}

// Why initWithForm refused a form, in the order it checks.
std::string refusal(const Value& form)
{
    if (!form.isDictionary())
        return "not a dictionary";
    if (!form.stringFor("path"))
        return "no \"path\" text";
    if (!form.stringFor("identifier"))
        return "no \"identifier\" text";
    return "\"bundleInfo\" is not a dictionary with a \"QSExtension\" dictionary";
}

} // namespace

Value OMDaemonClient::MatchedPlugIn::election() const
{
    return plugIn->annotations()["election"];
}

bool OMDaemonClient::MatchedPlugIn::elected() const
{
    return OMMatcher::electionText(plugIn->annotations()) != "0";
}

Value OMDaemonClient::MatchedPlugIn::extension() const
{
    return plugIn->annotations()["extension"];
}

std::optional<std::string> OMDaemonClient::MatchedPlugIn::resourceToken(std::string_view resource) const
{
    for (const auto& [name, token] : resourceTokens) {
        if (name == resource)
            return token;
    }
    return std::nullopt;
}

Result<OMDaemonClient::MatchReply> OMDaemonClient::matchesInReply(const Result<Value>& reply) const
{
    if (auto error = errorInReply(reply))
        return *error;
    MatchReply read { .reply = reply.value() };
    const Value& encoded = read.reply["matches"];
    if (encoded.isNone())
        return read;
    std::optional<Value> forms = convertFromConduit(encoded);
    if (!forms || !forms->isArray())
        return OMMakeError(4, "invalid reply format (matches)");

    size_t index = 0;
    for (const Value& form : forms->elements()) {
        auto plugIn = form.isDictionary() ? OMPlugInCore::initWithForm(form) : nullptr;
        if (!plugIn) {
            read.skipped.push_back({ index++, refusal(form) });
            continue;
        }
        ++index;
        MatchedPlugIn matched { .plugIn = std::move(plugIn), .form = form };
        // Tokens that are not text grant nothing a host could consume; they are left out.
        for (const auto& [name, token] : form["extensions"].entries()) {
            if (const std::string* text = token.asString())
                matched.resourceTokens.emplace_back(name, *text);
        }
        matched.overrider = textFor(form, "overrider");
        matched.overriding = textFor(form, "overriding");
        read.matches.push_back(std::move(matched));
    }
    return read;
}

Result<OMDaemonClient::MatchReply> OMDaemonClient::matchPlugInsSync(const Value& rules, uint64_t flags)
{
    return matchesInReply(waitForReply([&](ReplyBlock reply) { matchPlugIns(rules, flags, std::move(reply)); }));
}

} // namespace om

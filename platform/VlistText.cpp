#include "platform/VlistText.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <limits>

namespace om {

namespace {

// Dates with whole seconds in (-2^62, 2^62) have calendar text; their day count and seconds stay
// well inside int64 arithmetic. That is some 146 billion years either side of 1970.
constexpr int64_t kCalendarLimit = int64_t { 1 } << 62;
constexpr int64_t kSecondsPerDay = 86400;
constexpr size_t kLongestYear = 12;

struct CivilDate {
    int64_t year;
    unsigned month; // 1-12
    unsigned day; // 1-31
};

// Days since 1970-01-01 in the proleptic Gregorian calendar, and back (H. Hinnant's algorithms).
int64_t daysFromCivil(CivilDate date)
{
    const int64_t y = date.year - (date.month <= 2);
    const int64_t era = (y >= 0 ? y : y - 399) / 400;
    const auto yearOfEra = static_cast<unsigned>(y - era * 400);
    const unsigned dayOfYear = (153 * (date.month > 2 ? date.month - 3 : date.month + 9) + 2) / 5 + date.day - 1;
    const unsigned dayOfEra = yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear;
    return era * 146097 + static_cast<int64_t>(dayOfEra) - 719468;
}

CivilDate civilFromDays(int64_t days)
{
    days += 719468;
    const int64_t era = (days >= 0 ? days : days - 146096) / 146097;
    const auto dayOfEra = static_cast<unsigned>(days - era * 146097);
    const unsigned yearOfEra = (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
    const unsigned dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
    const unsigned mp = (5 * dayOfYear + 2) / 153;
    const unsigned month = mp < 10 ? mp + 3 : mp - 9;
    const unsigned day = dayOfYear - (153 * mp + 2) / 5 + 1;
    return { static_cast<int64_t>(yearOfEra) + era * 400 + (month <= 2), month, day };
}

unsigned daysInMonth(int64_t year, unsigned month)
{
    static constexpr unsigned kDays[] = { 31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31 };
    const bool leap = year % 4 == 0 && (year % 100 != 0 || year % 400 == 0);
    return month == 2 && leap ? 29 : kDays[month - 1];
}

bool isDigit(char c)
{
    return c >= '0' && c <= '9';
}

// The digits of 1 - 0.<digits>, as many as given; digits must not all be zero.
std::string complementFraction(std::string_view digits)
{
    std::string out(digits);
    size_t last = out.find_last_not_of('0');
    for (size_t i = 0; i < last; ++i)
        out[i] = static_cast<char>('9' - (out[i] - '0'));
    out[last] = static_cast<char>('0' + 10 - (out[last] - '0'));
    return out;
}

void appendTwoDigits(std::string& out, unsigned n)
{
    out.push_back(static_cast<char>('0' + n / 10));
    out.push_back(static_cast<char>('0' + n % 10));
}

void appendCalendar(std::string& out, int64_t seconds, std::string_view fraction)
{
    const int64_t days = seconds >= 0 ? seconds / kSecondsPerDay : -((-seconds + kSecondsPerDay - 1) / kSecondsPerDay);
    const auto secondOfDay = static_cast<unsigned>(seconds - days * kSecondsPerDay);
    const CivilDate date = civilFromDays(days);

    char year[24];
    auto [end, ec] = std::to_chars(year, year + sizeof year, date.year < 0 ? -date.year : date.year);
    (void)ec; // 24 characters hold any int64
    if (date.year < 0)
        out.push_back('-');
    else if (date.year > 9999)
        out.push_back('+');
    out.append(static_cast<size_t>(std::max<ptrdiff_t>(0, 4 - (end - year))), '0');
    out.append(year, end);
    out.push_back('-');
    appendTwoDigits(out, date.month);
    out.push_back('-');
    appendTwoDigits(out, date.day);
    out.push_back('T');
    appendTwoDigits(out, secondOfDay / 3600);
    out.push_back(':');
    appendTwoDigits(out, secondOfDay / 60 % 60);
    out.push_back(':');
    appendTwoDigits(out, secondOfDay % 60);
    if (!fraction.empty()) {
        out.push_back('.');
        out.append(fraction);
    }
    out.push_back('Z');
}

bool hasCalendarText(double seconds)
{
    if (!std::isfinite(seconds))
        return false;
    const double whole = std::floor(seconds);
    return whole > -0x1p62 && whole < 0x1p62;
}

// Reads exactly `count` digits at text[at...] into *value.
bool readDigits(std::string_view text, size_t& at, size_t count, unsigned& value)
{
    if (text.size() - at < count)
        return false;
    value = 0;
    for (size_t i = 0; i < count; ++i, ++at) {
        if (!isDigit(text[at]))
            return false;
        value = value * 10 + static_cast<unsigned>(text[at] - '0');
    }
    return true;
}

bool expect(std::string_view text, size_t& at, char c)
{
    if (at >= text.size() || text[at] != c)
        return false;
    ++at;
    return true;
}

// "[+-]YYYY" with more digits allowed only after a sign, up to kLongestYear.
bool readYear(std::string_view text, size_t& at, int64_t& year)
{
    bool negative = false;
    bool signedYear = false;
    if (at < text.size() && (text[at] == '+' || text[at] == '-')) {
        negative = text[at] == '-';
        signedYear = true;
        ++at;
    }
    const size_t first = at;
    while (at < text.size() && isDigit(text[at]))
        ++at;
    const size_t count = at - first;
    if (count < 4 || count > kLongestYear || (!signedYear && count != 4))
        return false;
    int64_t magnitude = 0;
    std::from_chars(text.data() + first, text.data() + at, magnitude);
    year = negative ? -magnitude : magnitude;
    return true;
}

// Whole seconds plus a decimal fraction, rounded once: for a negative whole, w + 0.f is written as
// -((|w| - 1) + (1 - 0.f)) so that from_chars sees the exact decimal.
double combine(int64_t whole, std::string_view fraction)
{
    if (fraction.empty() || fraction.find_first_not_of('0') == std::string_view::npos)
        return static_cast<double>(whole);
    std::string decimal;
    if (whole >= 0) {
        decimal = std::to_string(whole);
        decimal += '.';
        decimal += fraction;
    } else {
        decimal = '-' + std::to_string(-(whole + 1));
        decimal += '.';
        decimal += complementFraction(fraction);
    }
    double value = 0;
    std::from_chars(decimal.data(), decimal.data() + decimal.size(), value);
    return value;
}

} // namespace

void VlistText::appendDate(std::string& out, double secondsSince1970)
{
    if (!hasCalendarText(secondsSince1970))
        return appendReal(out, secondsSince1970);
    const double whole = std::floor(secondsSince1970);
    if (whole == secondsSince1970)
        return appendCalendar(out, static_cast<int64_t>(whole), {});

    // Here |seconds| < 2^52, so the shortest fixed form holds every integer digit exactly.
    char buffer[400];
    auto [end, ec] = std::to_chars(buffer, buffer + sizeof buffer, secondsSince1970, std::chars_format::fixed);
    (void)ec; // a double below 2^52 needs at most ~330 characters in fixed form
    std::string_view text(buffer, static_cast<size_t>(end - buffer));
    const size_t point = text.find('.');
    std::string_view fraction = text.substr(point + 1);
    if (secondsSince1970 > 0)
        return appendCalendar(out, static_cast<int64_t>(whole), fraction);
    appendCalendar(out, static_cast<int64_t>(whole), complementFraction(fraction));
}

std::optional<double> VlistText::parseDate(std::string_view text)
{
    if (text.empty() || text.back() != 'Z') {
        auto number = parseReal(text);
        if (!number || hasCalendarText(*number))
            return std::nullopt;
        return number;
    }

    size_t at = 0;
    int64_t year = 0;
    unsigned month, day, hour, minute, second;
    if (!readYear(text, at, year) || !expect(text, at, '-') || !readDigits(text, at, 2, month) || !expect(text, at, '-')
        || !readDigits(text, at, 2, day) || !expect(text, at, 'T') || !readDigits(text, at, 2, hour)
        || !expect(text, at, ':') || !readDigits(text, at, 2, minute) || !expect(text, at, ':')
        || !readDigits(text, at, 2, second))
        return std::nullopt;
    std::string_view fraction;
    if (at < text.size() && text[at] == '.') {
        const size_t first = ++at;
        while (at < text.size() && isDigit(text[at]))
            ++at;
        fraction = text.substr(first, at - first);
        if (fraction.empty())
            return std::nullopt;
    }
    if (at != text.size() - 1)
        return std::nullopt;
    if (month < 1 || month > 12 || day < 1 || day > daysInMonth(year, month) || hour > 23 || minute > 59 || second > 59)
        return std::nullopt;

    const int64_t days = daysFromCivil({ year, month, day });
    if (days < -kCalendarLimit / kSecondsPerDay - 1 || days > kCalendarLimit / kSecondsPerDay)
        return std::nullopt; // before the multiplication below could overflow
    const int64_t whole = days * kSecondsPerDay + hour * 3600 + minute * 60 + second;
    if (whole <= -kCalendarLimit || whole >= kCalendarLimit)
        return std::nullopt;
    return combine(whole, fraction);
}

void VlistText::appendReal(std::string& out, double value)
{
    if (std::isnan(value)) {
        out += "nan";
        return;
    }
    if (std::isinf(value)) {
        out += value < 0 ? "-inf" : "inf";
        return;
    }
    char buffer[32];
    auto [end, ec] = std::to_chars(buffer, buffer + sizeof buffer, value);
    (void)ec; // the shortest general form of a double fits in 24 characters
    out.append(buffer, end);
}

std::optional<double> VlistText::parseReal(std::string_view text)
{
    if (!text.empty() && text[0] == '+') {
        text.remove_prefix(1);
        if (!text.empty() && text[0] == '-')
            return std::nullopt;
    }
    double value = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (ec != std::errc() || end != text.data() + text.size())
        return std::nullopt;
    return value;
}

std::optional<Value> VlistText::parseInteger(std::string_view text, bool* outOfRange)
{
    if (outOfRange)
        *outOfRange = false;
    bool negative = false;
    if (!text.empty() && (text[0] == '+' || text[0] == '-')) {
        negative = text[0] == '-';
        text.remove_prefix(1);
    }
    if (text.empty())
        return std::nullopt;
    for (char c : text) {
        if (!isDigit(c))
            return std::nullopt;
    }
    uint64_t magnitude = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), magnitude);
    (void)end; // every character is a digit
    constexpr auto kSignedMax = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());
    if (ec == std::errc::result_out_of_range || (negative && magnitude > kSignedMax + 1)) {
        if (outOfRange)
            *outOfRange = true;
        return std::nullopt;
    }
    if (negative)
        return Value::integer(static_cast<int64_t>(0 - magnitude)); // wraps to INT64_MIN at 2^63
    if (magnitude > kSignedMax)
        return Value::unsignedInteger(magnitude);
    return Value::integer(static_cast<int64_t>(magnitude));
}

void VlistText::appendBase64(std::string& out, std::span<const uint8_t> bytes)
{
    static constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    out.reserve(out.size() + (bytes.size() + 2) / 3 * 4);
    size_t i = 0;
    for (; i + 3 <= bytes.size(); i += 3) {
        const uint32_t group = uint32_t { bytes[i] } << 16 | uint32_t { bytes[i + 1] } << 8 | bytes[i + 2];
        out.push_back(kAlphabet[group >> 18]);
        out.push_back(kAlphabet[group >> 12 & 0x3f]);
        out.push_back(kAlphabet[group >> 6 & 0x3f]);
        out.push_back(kAlphabet[group & 0x3f]);
    }
    if (i == bytes.size())
        return;
    const bool two = bytes.size() - i == 2;
    const uint32_t group = uint32_t { bytes[i] } << 16 | (two ? uint32_t { bytes[i + 1] } << 8 : 0);
    out.push_back(kAlphabet[group >> 18]);
    out.push_back(kAlphabet[group >> 12 & 0x3f]);
    out.push_back(two ? kAlphabet[group >> 6 & 0x3f] : '=');
    out.push_back('=');
}

std::optional<std::vector<uint8_t>> VlistText::parseBase64(std::string_view text)
{
    auto sextet = [](char c) -> int {
        if (c >= 'A' && c <= 'Z')
            return c - 'A';
        if (c >= 'a' && c <= 'z')
            return c - 'a' + 26;
        if (isDigit(c))
            return c - '0' + 52;
        if (c == '+')
            return 62;
        if (c == '/')
            return 63;
        return -1;
    };
    std::vector<uint8_t> bytes;
    bytes.reserve(text.size() / 4 * 3);
    uint32_t group = 0;
    size_t symbols = 0;
    size_t padding = 0;
    for (char c : text) {
        if (c == ' ' || c == '\t' || c == '\n' || c == '\r')
            continue;
        if (c == '=') {
            ++padding;
            continue;
        }
        const int value = sextet(c);
        if (value < 0 || padding > 0)
            return std::nullopt;
        group = group << 6 | static_cast<uint32_t>(value);
        if (++symbols % 4 == 0) {
            bytes.push_back(static_cast<uint8_t>(group >> 16));
            bytes.push_back(static_cast<uint8_t>(group >> 8));
            bytes.push_back(static_cast<uint8_t>(group));
            group = 0;
        }
    }
    const size_t tail = symbols % 4;
    if (tail == 1 || (padding > 0 && (tail < 2 || tail + padding != 4)))
        return std::nullopt;
    if (tail == 2) {
        bytes.push_back(static_cast<uint8_t>(group >> 4));
    } else if (tail == 3) {
        bytes.push_back(static_cast<uint8_t>(group >> 10));
        bytes.push_back(static_cast<uint8_t>(group >> 2));
    }
    return bytes;
}

} // namespace om

#include "platform/VersionString.h"

namespace om {

namespace {

bool isDigit(char c)
{
    return c >= '0' && c <= '9';
}

// Takes the digit run starting at index, advancing index past it; returns it without leading zeros.
std::string_view takeNumber(std::string_view text, size_t& index)
{
    size_t start = index;
    while (index < text.size() && isDigit(text[index]))
        ++index;
    std::string_view run = text.substr(start, index - start);
    size_t significant = run.find_first_not_of('0');
    return significant == std::string_view::npos ? std::string_view() : run.substr(significant);
}

int sign(int value)
{
    return (value > 0) - (value < 0);
}

} // namespace

int VersionString::compare(std::string_view a, std::string_view b)
{
    size_t i = 0;
    size_t j = 0;
    while (i < a.size() && j < b.size()) {
        if (isDigit(a[i]) && isDigit(b[j])) {
            // Compared as text so that runs of any length work: fewer significant digits is smaller.
            std::string_view x = takeNumber(a, i);
            std::string_view y = takeNumber(b, j);
            if (x.size() != y.size())
                return x.size() < y.size() ? -1 : 1;
            if (int order = x.compare(y); order != 0)
                return sign(order);
            continue;
        }
        auto x = static_cast<unsigned char>(a[i]);
        auto y = static_cast<unsigned char>(b[j]);
        if (x != y)
            return x < y ? -1 : 1;
        ++i;
        ++j;
    }
    if (i < a.size())
        return 1;
    if (j < b.size())
        return -1;
    return 0;
}

std::string VersionString::equivalenceKey(std::string_view text)
{
    std::string key;
    key.reserve(text.size());
    size_t index = 0;
    while (index < text.size()) {
        if (!isDigit(text[index])) {
            key.push_back(text[index++]);
            continue;
        }
        std::string_view number = takeNumber(text, index);
        if (number.empty())
            key.push_back('0');
        else
            key.append(number);
    }
    return key;
}

} // namespace om

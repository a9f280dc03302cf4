// The annotation file assembled entry by entry must be, byte for byte, the whole table written
// at once, through every kind of change.
#include <gtest/gtest.h>

#include "omd/OMDAnnotationText.h"
#include "platform/Vlist.h"

using om::OMDAnnotationText;
using om::Value;

namespace {

std::string whole(const std::map<std::string, Value>& table)
{
    std::vector<Value::Entry> entries(table.begin(), table.end());
    return om::Vlist::writeXml(
        Value::dictionary({ { "version", Value::integer(16) }, { "data", Value::dictionary(std::move(entries)) } }));
}

TEST(OMDAnnotationText, AssembledTextIsTheWholeTableWrittenAtOnceThroughEveryChange)
{
    OMDAnnotationText text;
    std::map<std::string, Value> table;
    const std::vector<std::pair<std::string, Value>> changes {
        { "com.example.a", Value::dictionary({ { "election", 1 } }) },
        { "com.example.b", Value::dictionary({}) }, // written on its key's line
        { "com.example.c&<>\"'",
            Value::dictionary({ { "extension",
                Value::dictionary({ { "list", Value::array({ Value::string("x < y"), Value::real(0.5) }) },
                    { "when", Value::date(0) }, { "bytes", Value::data(std::vector<uint8_t> { 0, 255 }) } }) } }) },
        { "com.example.a", Value::dictionary({ { "election", Value::boolean(true) } }) }, // equal, written otherwise
        { "com.example.b", Value() }, // removed
        { "", Value::dictionary({ { "election", 0 } }) },
    };
    EXPECT_EQ(text.compose(table, 16), whole(table)) << "empty table";
    for (const auto& [key, value] : changes) {
        if (value.isNone())
            table.erase(key);
        else
            table[key] = value;
        text.forget(key);
        EXPECT_EQ(text.compose(table, 16), whole(table)) << "after changing " << key;
    }
    table.clear();
    text.clear();
    EXPECT_EQ(text.compose(table, 16), whole(table)) << "emptied";
}

TEST(OMDAnnotationText, KeysThatXmlCannotCarryAreLeftToTheWholeWriter)
{
    // Both keys become U+FFFD; the writer keeps the first, and so must the assembled text.
    OMDAnnotationText text;
    const std::map<std::string, Value> table { { std::string("\x01", 1), Value::dictionary({ { "election", 1 } }) },
        { std::string("\x02", 1), Value::dictionary({ { "election", 2 } }) } };
    EXPECT_EQ(text.compose(table, 16), whole(table));
    auto read = om::Vlist::parse(text.compose(table, 16));
    ASSERT_TRUE(read.ok());
    EXPECT_EQ(read.value()["data"].entries().size(), 1u);
}

} // namespace

#include <gtest/gtest.h>

#include "Ombrel/OMMakeError.h"

using om::OMMakeError;
using om::OMMakeErrorWithFormat;

TEST(OMMakeError, CarriesTheDaemonsDomainCodeAndMessage)
{
    auto error = OMMakeError(22, std::string("bad argument"));
    EXPECT_EQ(error.domain(), "Ombrel");
    EXPECT_EQ(error.code(), 22);
    EXPECT_EQ(error.description(), "bad argument");
    EXPECT_EQ(OMMakeError(-1, "negative codes pass").code(), -1);
}

TEST(OMMakeError, AbsentMessageLeavesNoDescription)
{
    EXPECT_FALSE(OMMakeError(3).description().has_value());
    EXPECT_FALSE(OMMakeError(3, std::nullopt).description().has_value());
    EXPECT_FALSE(OMMakeError(3, static_cast<const char*>(nullptr)).description().has_value());
    EXPECT_EQ(OMMakeError(3).localizedDescription(), "Ombrel error 3");
    // An empty message is a message.
    EXPECT_EQ(OMMakeError(3, "").description(), "");
}

TEST(OMMakeError, WithFormatFormatsTheDescription)
{
    auto error = OMMakeErrorWithFormat(2, "plug-in %s has no %@ (%d)", "com.orvex.share", om::Value("version"), 7);
    EXPECT_EQ(error.domain(), "Ombrel");
    EXPECT_EQ(error.code(), 2);
    EXPECT_EQ(error.description(), "plug-in com.orvex.share has no version (7)");
    EXPECT_EQ(OMMakeErrorWithFormat(2, "missing %s").description(), "missing <?>");
}

TEST(OMMakeError, WithNullFormatLeavesNoDescription)
{
    auto error = OMMakeErrorWithFormat(5, nullptr, 1, "ignored");
    EXPECT_EQ(error.code(), 5);
    EXPECT_FALSE(error.description().has_value());
    EXPECT_EQ(error, OMMakeError(5));
}

#include <gtest/gtest.h>

#include "Ombrel/OMBundle.h"
#include "omd/OMDPlugInSignature.h"

using om::OMDPlugInSignature;

TEST(OMDPlugInSignature, EverySignatureHasAHashOfItsOwn)
{
    const std::string url = om::OMBundle::fileURL("/System/Library/PlugIns/Share.appex");
    std::optional<om::OMError> error;

    auto first = OMDPlugInSignature::initWithURL(url, &error);
    auto second = OMDPlugInSignature::initWithURL(url, &error);

    ASSERT_TRUE(first);
    ASSERT_TRUE(second);
    EXPECT_FALSE(error);
    EXPECT_EQ(first->cdhash().size(), 20u);
    EXPECT_EQ(second->cdhash().size(), 20u);
    EXPECT_NE(first->cdhash(), second->cdhash());
    EXPECT_EQ(first->requirement(), "dummy requirement");
    EXPECT_EQ(second->requirement(), first->requirement());
}

TEST(OMDPlugInSignature, NothingAtTheUrlIsRead)
{
    auto signature = OMDPlugInSignature::initWithURL("not even a URL");
    ASSERT_TRUE(signature);
    EXPECT_EQ(signature->cdhash().size(), 20u);
}

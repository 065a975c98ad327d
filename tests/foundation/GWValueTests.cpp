#include <gtest/gtest.h>

#include "foundation/GWFoundation.h"

TEST(GWValue, IntegersCompareByValueWhateverTheirSignedness) {
    EXPECT_EQ(GWValue(std::int64_t(7)), GWValue(std::uint64_t(7)));
    EXPECT_NE(GWValue(std::int64_t(-1)), GWValue(UINT64_MAX));
    EXPECT_NE(GWValue(true), GWValue(1));
}

TEST(GWValue, NumbersReadAsTheOtherNumericKinds) {
    EXPECT_TRUE(GWValue(2).boolValue());
    EXPECT_EQ(GWValue(true).integerValue(), 1);
    EXPECT_EQ(GWValue(2.9).integerValue(), 2);
    EXPECT_EQ(GWValue("text").integerValue(), 0);
    EXPECT_EQ(GWValue(std::int64_t(-1)).unsignedValue(), UINT64_MAX);
}

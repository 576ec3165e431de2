// The callback columns that the scanner lends to every group's scan in turn.
#include "Delivery.h"

#include <gtest/gtest.h>

TEST(Delivery, RowsComeBackEmptyForTheNextGroupAndALargeGroupsAreGivenBack)
{
    Delivery rows(0);
    // A large group's scan: half its rows changed, some with texts.
    rows.Resize(20000);
    for (size_t i = 0; i < 10000; ++i) {
        V_VT(&rows.values[i]) = i % 2 ? VT_BSTR : VT_R8;
        if (i % 2)
            V_BSTR(&rows.values[i]) = SysAllocString(L"text");
        else
            V_R8(&rows.values[i]) = 1.5;
    }
    rows.ClearValues(10000);
    for (const VARIANT &v : rows.values)
        ASSERT_EQ(V_VT(&v), VT_EMPTY);

    // A smaller group next keeps the rows (no allocation per scan)...
    rows.Resize(6000);
    EXPECT_EQ(rows.Count(), 6000u);
    EXPECT_GE(rows.values.capacity(), 20000u);
    // ...a much smaller one has them given back, and every row it gets is
    // empty and as many as it asked for.
    rows.Resize(100);
    EXPECT_EQ(rows.Count(), 100u);
    EXPECT_LT(rows.values.capacity(), 20000u);
    EXPECT_EQ(rows.clients.size(), 100u);
    EXPECT_EQ(rows.times.size(), 100u);
    EXPECT_EQ(rows.qualities.size(), 100u);
    EXPECT_EQ(rows.errors.size(), 100u);
    for (const VARIANT &v : rows.values)
        ASSERT_EQ(V_VT(&v), VT_EMPTY);
    // Growing again gives empty rows too.
    rows.Resize(3000);
    for (const VARIANT &v : rows.values)
        ASSERT_EQ(V_VT(&v), VT_EMPTY);
}

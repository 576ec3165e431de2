// The callback columns that the scanner lends to every group's scan in turn.
#include "Delivery.h"

#include <gtest/gtest.h>

TEST(Delivery, RowsComeBackEmptyForTheNextGroupAndAGoneLargeGroupsAreGivenBack)
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

    // Small groups scanned in turn with the large one never make its rows
    // come and go...
    for (unsigned i = 0; i < 3 * Delivery::kShrinkCheck; ++i) {
        rows.Resize(i % 2 ? 100 : 20000);
        ASSERT_GE(rows.values.capacity(), 20000u);
        ASSERT_EQ(rows.Count(), i % 2 ? 100u : 20000u);
    }
    // ...but once it has gone, its rows are given back, and every row a
    // scan gets is empty and as many as it asked for.
    for (unsigned i = 0; i < 2 * Delivery::kShrinkCheck; ++i)
        rows.Resize(100);
    EXPECT_LT(rows.values.capacity(), 20000u);
    EXPECT_EQ(rows.Count(), 100u);
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

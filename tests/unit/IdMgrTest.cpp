#include "IdMgr.h"

#include <gtest/gtest.h>

#include <cwchar>
#include <string>
#include <vector>

namespace {
using Ranges = std::vector<std::pair<unsigned long, unsigned long>>;

Ranges RangesOf(const CRangeSet<unsigned long> &set)
{
    Ranges out;
    for (auto *r = set.Head(); r; r = r->next)
        out.emplace_back(r->low, r->high);
    return out;
}
} // namespace

TEST(RangeSet, InsertMergesNeighboursAndIgnoresDuplicates)
{
    CRangeSet<unsigned long> set;
    set.Insert(5);
    set.Insert(7);
    EXPECT_EQ(RangesOf(set), (Ranges{{5, 5}, {7, 7}}));
    set.Insert(6);
    EXPECT_EQ(RangesOf(set), (Ranges{{5, 7}}));
    set.Insert(6);
    set.Insert(4);
    set.Insert(8);
    EXPECT_EQ(RangesOf(set), (Ranges{{4, 8}}));
    set.Insert(1);
    set.Insert(0xFFFFFFFFul);
    EXPECT_EQ(RangesOf(set), (Ranges{{1, 1}, {4, 8}, {0xFFFFFFFFul, 0xFFFFFFFFul}}));
}

TEST(RangeSet, RemoveSplitsShrinksAndIgnoresAbsentValues)
{
    CRangeSet<unsigned long> set(1, 10);
    set.Remove(5);
    EXPECT_EQ(RangesOf(set), (Ranges{{1, 4}, {6, 10}}));
    set.Remove(5);
    set.Remove(11);
    set.Remove(0);
    EXPECT_EQ(RangesOf(set), (Ranges{{1, 4}, {6, 10}}));
    set.Remove(1);
    set.Remove(10);
    EXPECT_EQ(RangesOf(set), (Ranges{{2, 4}, {6, 9}}));
    for (unsigned long v = 2; v <= 4; ++v)
        set.Remove(v);
    EXPECT_EQ(RangesOf(set), (Ranges{{6, 9}}));
    EXPECT_EQ(set.TakeLowest(), 6ul);
    EXPECT_EQ(set.TakeLowest(), 7ul);
    CRangeSet<unsigned long> empty;
    EXPECT_EQ(empty.TakeLowest(), 0ul);
}

TEST(RangeSet, ManyRangesReuseTheirPlacesAcrossSlabs)
{
    // More ranges than one slab holds, emptied and filled again, split from
    // one range and merged back into it.
    CRangeSet<unsigned long> set;
    Ranges expected;
    for (unsigned long v = 2; v <= 2000; v += 2) {
        set.Insert(v);
        expected.emplace_back(v, v);
    }
    EXPECT_EQ(RangesOf(set), expected);
    for (int round = 0; round < 3; ++round) {
        for (unsigned long v = 2; v <= 2000; v += 2)
            set.Remove(v);
        EXPECT_TRUE(set.IsEmpty());
        for (unsigned long v = 2000; v >= 2; v -= 2)
            set.Insert(v);
        EXPECT_EQ(RangesOf(set), expected);
    }
    CRangeSet<unsigned long> whole(1, 3000);
    for (unsigned long v = 2; v <= 2000; v += 2)
        whole.Remove(v);
    EXPECT_EQ(RangesOf(whole).size(), 1001u);
    for (unsigned long v = 2; v <= 2000; v += 2)
        whole.Insert(v);
    EXPECT_EQ(RangesOf(whole), (Ranges{{1, 3000}}));
}

TEST(IdMgr, HandsOutLowestAndDelaysReuse)
{
    CIdMgr ids;
    EXPECT_EQ(ids.GetId(), 1ul);
    EXPECT_EQ(ids.GetId(), 2ul);
    EXPECT_EQ(ids.GetId(), 3ul);
    ids.ReleaseId(1);
    ids.ReleaseId(2);
    EXPECT_EQ(ids.GetId(), 4ul) << "a released number waits while others are available";
}

TEST(IdMgr, ExchangesRolesWhenTheAvailableSetRunsDry)
{
    CIdMgr ids(1, 10);
    for (unsigned long expected = 1; expected <= 10; ++expected)
        ASSERT_EQ(ids.GetId(), expected);
    ids.ReleaseId(3);
    ids.ReleaseId(10);
    ids.ReleaseId(9);
    EXPECT_EQ(ids.GetId(), 3ul);
    ids.ReleaseId(5); // goes into the set that is now the released one
    EXPECT_EQ(ids.GetId(), 9ul);
    EXPECT_EQ(ids.GetId(), 10ul);
    EXPECT_EQ(ids.GetId(), 5ul);
    EXPECT_EQ(ids.GetId(), 0ul) << "both sets empty";
    ids.ReleaseId(7);
    EXPECT_EQ(ids.GetId(), 7ul);
}

TEST(IdMgr, DefaultGroupNamesUseFreshNumbers)
{
    wchar_t a[kDefaultGroupNameChars], b[kDefaultGroupNameChars];
    MakeDefaultGroupName(a);
    MakeDefaultGroupName(b);
    unsigned long na = 0, nb = 0;
    ASSERT_EQ(swscanf(a, L"$Group_%lu$", &na), 1) << a;
    ASSERT_EQ(swscanf(b, L"$Group_%lu$", &nb), 1) << b;
    EXPECT_GT(nb, na);
    EXPECT_EQ(std::wstring(a), L"$Group_" + std::to_wstring(na) + L"$");
    // The widest name fits the documented buffer exactly.
    wchar_t widest[kDefaultGroupNameChars];
    EXPECT_EQ(swprintf(widest, kDefaultGroupNameChars, L"$Group_%lu$", 4294967295ul), kDefaultGroupNameChars - 1);
}

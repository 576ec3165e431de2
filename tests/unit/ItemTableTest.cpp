// A group's item table: order, holes left by removals, and their compaction.
#include "ItemTable.h"
#include "FakeGroup.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <vector>

namespace {
std::unique_ptr<COPCItem> MakeItem(FakeGroup &group)
{
    OPCITEMDEF def = {};
    def.szItemID = const_cast<wchar_t *>(L"\\\\.\\p\\o.m");
    def.bActive = TRUE;
    auto item = COPCItem::Create(def);
    OPCITEMRESULT result;
    EXPECT_EQ(item->Init(&group, def, result), S_OK);
    return item;
}

std::vector<OPCHANDLE> Handles(const CItemTable &table)
{
    std::vector<OPCHANDLE> handles;
    table.ForEach([&](COPCItem &item) { handles.push_back(item.ServerHandle()); });
    return handles;
}
} // namespace

TEST(ItemTable, KeepsHandleOrderThroughRemovalsAndCompaction)
{
    FakeGroup group;
    std::vector<OPCHANDLE> all;
    {
        CItemTable table;
        // Handles rise; the first three go in out of order.
        std::vector<std::unique_ptr<COPCItem>> first;
        for (int i = 0; i < 3; ++i)
            first.push_back(MakeItem(group));
        for (int i : {2, 0, 1}) {
            all.push_back(first[i]->ServerHandle());
            ASSERT_TRUE(table.Insert(std::move(first[i])));
        }
        for (int i = 0; i < 297; ++i) {
            auto item = MakeItem(group);
            all.push_back(item->ServerHandle());
            ASSERT_TRUE(table.Insert(std::move(item)));
        }
        std::sort(all.begin(), all.end());
        EXPECT_EQ(Handles(table), all);
        EXPECT_EQ(group.active.size(), 300u);

        // Every other one, then most of the rest: holes, then compactions.
        std::vector<OPCHANDLE> left;
        for (size_t i = 0; i < all.size(); ++i) {
            if (i % 2 == 0 || i % 7 == 1) {
                EXPECT_TRUE(table.Erase(all[i]));
                EXPECT_FALSE(table.Erase(all[i])) << "a removed item is gone";
                EXPECT_EQ(table.Find(all[i]), nullptr);
            } else {
                left.push_back(all[i]);
            }
        }
        EXPECT_EQ(table.size(), left.size());
        EXPECT_EQ(Handles(table), left);
        EXPECT_EQ(group.active.size(), left.size()) << "a removed item left the active list";
        for (OPCHANDLE h : left)
            ASSERT_NE(table.Find(h), nullptr);
        EXPECT_EQ(table.Find(all.back() + 1000), nullptr);
        EXPECT_EQ(table.Find(0), nullptr);
    }
    EXPECT_TRUE(group.active.empty()) << "the table's end deletes its items";
}

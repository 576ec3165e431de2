#include "ItemIdChecker.h"

#include <gtest/gtest.h>

#include <string>

TEST(ItemIdChecker, GivesTheSyntaxCodes)
{
    struct Case {
        const wchar_t *id;
        int code;
    } cases[] = {
        {L"\\\\plant7\\proc1\\Waveform.cosine", 0},
        {L"\\\\.\\proc1\\Waveform.cosine", 0},
        {L"\\\\node.b\\p_2\\obj\\sub.member", 0},
        {L"\\\\.\\proc1\\Waveform.", 0},
        {L"\\\\.\\proc1\\Waveform..x", 8},
        {L"\\\\.\\proc1\\..\\obj", 8},
        {L"\\\\.\\proc1\\.x", 8},
        {L"\\\\.\\\\proc1\\obj", 8},
        {L"\\\\.\\proc1", 2},
        {L"\\\\.\\proc1\\", 2},
        {L"\\\\.", 4},
        {L"\\\\.\\", 4},
        {L"\\\\", 3},
        {L"\\\\\\x", 5},
        {L"\\x\\y", 6},
        {L"", 6},
        {L"\\", 6},
        {L"\\\\.x\\p\\o", 7},
        {L"\\\\.\\1proc\\obj", 9},
        {L"\\\\.\\pro-c\\obj", 9},
        {L"\\\\.\\p\\'it''s'", 0},
        {L"\\\\.\\p\\''", 0},
        {L"\\\\.\\p\\'open", 14},
        {L"\\\\.\\p\\'a'b", 11},
        {L"\\\\.\\p\\o\\", 12},
        {L"\\\\.\\p\\o.x\nmore", 11},
        {L"\\\\ host\\p\\o", 13},
        {L"\\\\/x\\p\\o", 13},
    };
    for (const Case &c : cases)
        EXPECT_EQ(static_cast<int>(CheckItemIdentifierCode(c.id)), c.code) << c.id;
    EXPECT_EQ(static_cast<int>(CheckItemIdentifierCode(nullptr)), 6);
}

TEST(ItemIdChecker, MapsCodesToTheirResults)
{
    EXPECT_EQ(CheckItemIdentifier(L"\\\\.\\p\\o.m"), S_OK);
    EXPECT_EQ(CheckItemIdentifier(L"\\\\.\\proc1"), static_cast<HRESULT>(0x8ABC0027));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\"), static_cast<HRESULT>(0x8ABC0022));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\."), static_cast<HRESULT>(0x8ABC0025));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\\\"), static_cast<HRESULT>(0x8ABC0101));
    EXPECT_EQ(CheckItemIdentifier(L"x"), static_cast<HRESULT>(0x8ABC0100));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\a/"), static_cast<HRESULT>(0x8ABC0024));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\a\\.p"), static_cast<HRESULT>(0x8ABC0102));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\a\\9"), static_cast<HRESULT>(0x8ABC0026));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\a\\p\\'x'y"), static_cast<HRESULT>(0x8ABC0028));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\a\\p\\o\\"), static_cast<HRESULT>(0x8ABC0030));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\ a"), static_cast<HRESULT>(0x8ABC0023));
    EXPECT_EQ(CheckItemIdentifier(L"\\\\a\\p\\'x"), static_cast<HRESULT>(0x8ABC0104));
    // Huge identifiers are walked without trouble.
    std::wstring huge = L"\\\\a\\p\\" + std::wstring(100000, L'x');
    EXPECT_EQ(CheckItemIdentifier(huge.c_str()), S_OK);
    std::wstring quote = L"\\\\a\\p\\'" + std::wstring(100000, L'x');
    EXPECT_EQ(CheckItemIdentifierCode(quote.c_str()), ItemIdCode::UnclosedQuote);
}

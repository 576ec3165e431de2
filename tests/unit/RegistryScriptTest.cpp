#include "RegistryScript.h"

#include <gtest/gtest.h>

namespace {
const char kScript[] = R"(; test script
key NoRemove Kept
key Kept\Plain = 'plain default'
key Kept\Plain\Sub
key ForceRemove Kept\Forced = '%MODULE%'
value Kept\Plain Named = 'named data'
)";

class RegistryScriptTest : public testing::Test {
protected:
    void SetUp() override
    {
        RegDeleteTreeW(HKEY_CURRENT_USER, kRoot);
        ASSERT_EQ(RegCreateKeyExW(HKEY_CURRENT_USER, kRoot, 0, nullptr, 0, KEY_ALL_ACCESS, nullptr, &m_root, nullptr),
                  ERROR_SUCCESS);
    }
    void TearDown() override
    {
        RegCloseKey(m_root);
        RegDeleteTreeW(HKEY_CURRENT_USER, kRoot);
        RegDeleteKeyW(HKEY_CURRENT_USER, kRoot);
    }

    bool KeyExists(const wchar_t *path)
    {
        HKEY key;
        if (RegOpenKeyExW(m_root, path, 0, KEY_READ, &key) != ERROR_SUCCESS)
            return false;
        RegCloseKey(key);
        return true;
    }
    std::wstring Value(const wchar_t *path, const wchar_t *name)
    {
        wchar_t data[512] = {};
        DWORD size = sizeof data;
        if (RegGetValueW(m_root, path, name, RRF_RT_REG_SZ, nullptr, data, &size) != ERROR_SUCCESS)
            return L"<missing>";
        return data;
    }

    static constexpr const wchar_t *kRoot = L"Software\\SkylarcRegistryScriptTest";
    HKEY m_root = nullptr;
};
} // namespace

TEST_F(RegistryScriptTest, ParsesRecordsAndSubstitutesTheModule)
{
    CRegistryScript script;
    ASSERT_TRUE(script.Parse(kScript, L"C:\\PROGRA~1\\Local.exe"));
    ASSERT_EQ(script.Records().size(), 5u);
    EXPECT_EQ(script.Records()[0].flag, CRegistryScript::KeyFlag::NoRemove);
    EXPECT_EQ(script.Records()[3].data, L"C:\\PROGRA~1\\Local.exe");
    EXPECT_TRUE(script.Records()[4].isValue);
    EXPECT_FALSE(script.Parse("bogus line\n", L""));
    EXPECT_FALSE(script.Parse("key Unterminated = 'x\n", L""));
    EXPECT_FALSE(script.Parse("value OnlyKey\n", L""));
}

TEST_F(RegistryScriptTest, RegisterReplacesForcedKeysAndUnregisterKeepsNoRemove)
{
    CRegistryScript script;
    ASSERT_TRUE(script.Parse(kScript, L"module.exe"));
    // A stale subkey under a ForceRemove key disappears on registration.
    HKEY stale;
    ASSERT_EQ(RegCreateKeyExW(m_root, L"Kept\\Forced\\Stale", 0, nullptr, 0, KEY_ALL_ACCESS, nullptr, &stale, nullptr),
              ERROR_SUCCESS);
    RegCloseKey(stale);

    ASSERT_EQ(script.Register(m_root), S_OK);
    ASSERT_EQ(script.Register(m_root), S_OK) << "registering twice is harmless";
    EXPECT_FALSE(KeyExists(L"Kept\\Forced\\Stale"));
    EXPECT_EQ(Value(L"Kept\\Forced", nullptr), L"module.exe");
    EXPECT_EQ(Value(L"Kept\\Plain", nullptr), L"plain default");
    EXPECT_EQ(Value(L"Kept\\Plain", L"Named"), L"named data");
    EXPECT_TRUE(KeyExists(L"Kept\\Plain\\Sub"));

    script.Unregister(m_root);
    EXPECT_TRUE(KeyExists(L"Kept"));
    EXPECT_FALSE(KeyExists(L"Kept\\Plain"));
    EXPECT_FALSE(KeyExists(L"Kept\\Forced"));
    script.Unregister(m_root); // nothing left to remove: no error, no change
    EXPECT_TRUE(KeyExists(L"Kept"));
}

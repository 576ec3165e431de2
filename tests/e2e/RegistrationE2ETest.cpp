// Runs Local.exe with its registration switches and reads the records back
// from this prefix's registry. Ends with the server registered again.
#include "ComPtr.h"
#include "Handle.h"
#include "ServerProcess.h"
#include "opcda.h"

#include <gtest/gtest.h>

namespace {
const std::wstring kClsidKey = L"CLSID\\{5B1E7A20-4C3D-11d3-9A44-00A0C9E2B7F1}";
const std::wstring kAppId = L"{5B1E7A21-4C3D-11d3-9A44-00A0C9E2B7F1}";
constexpr DWORD kRunTimeoutMs = 30000;

long RunServerExe(const std::wstring &arguments)
{
    return RunAndWait(L"\"" + ServerExePath() + L"\" " + arguments, kRunTimeoutMs);
}

std::wstring ShortPath(const std::wstring &path)
{
    wchar_t out[MAX_PATH];
    DWORD n = GetShortPathNameW(path.c_str(), out, MAX_PATH);
    return n && n < MAX_PATH ? std::wstring(out, n) : path;
}

bool CategoryRegistered(const wchar_t *catid)
{
    return KeyExists(HKEY_CLASSES_ROOT, kClsidKey + L"\\Implemented Categories\\" + catid);
}
} // namespace

TEST(RegistrationE2E, RegServerWritesEveryRecordAndUnregServerRemovesThem)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    // Any letter case; no type library lies beside the executable, so the
    // exit code is that failure although every record is written.
    long rc = RunServerExe(L"/regserver");
    EXPECT_NE(rc, 0);
    EXPECT_NE(rc, -1);

    HKEY cr = HKEY_CLASSES_ROOT;
    EXPECT_EQ(ReadString(cr, L"Tarnwell.SkylarcOPCServer", nullptr), L"OPC Server Interface to Skylarc");
    EXPECT_EQ(ReadString(cr, L"Tarnwell.SkylarcOPCServer\\CLSID", nullptr), L"{5B1E7A20-4C3D-11d3-9A44-00A0C9E2B7F1}");
    EXPECT_EQ(ReadString(cr, L"Tarnwell.SkylarcOPCServer\\CurVer", nullptr), L"Tarnwell.SkylarcOPCServer.1");
    EXPECT_EQ(ReadString(cr, L"Tarnwell.SkylarcOPCServer\\OPC\\Vendor", nullptr), L"Tarnwell, Inc.");
    EXPECT_EQ(ReadString(cr, L"Tarnwell.SkylarcOPCServer.1", nullptr), L"OPC Server Interface to Skylarc");
    EXPECT_EQ(ReadString(cr, L"Tarnwell.SkylarcOPCServer.1\\CLSID", nullptr),
              L"{5B1E7A20-4C3D-11d3-9A44-00A0C9E2B7F1}");
    EXPECT_EQ(ReadString(cr, kClsidKey, nullptr), L"OPC Server Interface to Skylarc");
    EXPECT_EQ(ReadString(cr, kClsidKey + L"\\ProgID", nullptr), L"Tarnwell.SkylarcOPCServer.1");
    EXPECT_EQ(ReadString(cr, kClsidKey + L"\\VersionIndependentProgID", nullptr), L"Tarnwell.SkylarcOPCServer");
    EXPECT_EQ(ReadString(cr, kClsidKey + L"\\LocalServer32", nullptr), ShortPath(ServerExePath()));
    EXPECT_EQ(ReadString(cr, kClsidKey, L"AppID"), kAppId);
    EXPECT_EQ(ReadString(cr, L"AppID\\Local.EXE", L"AppID"), kAppId);
    EXPECT_EQ(ReadString(cr, L"AppID\\" + kAppId, nullptr), L"Local");
    EXPECT_TRUE(CategoryRegistered(L"{63D5F430-CFE4-11d1-B2C8-0060083BA1FB}"));
    EXPECT_TRUE(CategoryRegistered(L"{63D5F432-CFE4-11d1-B2C8-0060083BA1FB}"));

    // Registering again replaces the forced keys instead of merging into them.
    HKEY stale;
    ASSERT_EQ(RegCreateKeyExW(cr, (kClsidKey + L"\\LocalServer32\\Stale").c_str(), 0, nullptr, 0, KEY_ALL_ACCESS,
                              nullptr, &stale, nullptr),
              ERROR_SUCCESS);
    RegCloseKey(stale);
    RunServerExe(L"-RegServer");
    EXPECT_FALSE(KeyExists(cr, kClsidKey + L"\\LocalServer32\\Stale"));

    EXPECT_EQ(RunServerExe(L"-UnregServer"), 0);
    EXPECT_FALSE(KeyExists(cr, L"Tarnwell.SkylarcOPCServer"));
    EXPECT_FALSE(KeyExists(cr, L"Tarnwell.SkylarcOPCServer.1"));
    EXPECT_FALSE(KeyExists(cr, kClsidKey));
    EXPECT_FALSE(KeyExists(cr, L"AppID\\" + kAppId));
    EXPECT_FALSE(KeyExists(cr, L"AppID\\Local.EXE"));
    EXPECT_TRUE(KeyExists(cr, L"AppID"));
    EXPECT_TRUE(KeyExists(cr, L"CLSID"));
    EXPECT_EQ(RunServerExe(L"/UnregServer"), 0) << "nothing registered is not an error";

    RunServerExe(L"/RegServer");
    EXPECT_EQ(ReadString(cr, kClsidKey + L"\\LocalServer32", nullptr), ShortPath(ServerExePath()));
}

TEST(RegistrationE2E, AServerStartedByHandServesClientsAndExitsAfterTheLast)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    // "/RegServer /s" is no registration switch: the process serves, and with
    // no client connected it keeps running.
    UniqueHandle process(StartProcess(L"\"" + ServerExePath() + L"\" /RegServer /s"));
    ASSERT_TRUE(process);
    EXPECT_EQ(WaitForSingleObject(process.Get(), 2000), static_cast<DWORD>(WAIT_TIMEOUT)) << "still serving";
    {
        // The running process serves this client: no second process starts.
        ComPtr<IOPCServer> server;
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        EXPECT_EQ(CountServerProcesses(), 1);
    }
    ASSERT_EQ(WaitForSingleObject(process.Get(), 20000), static_cast<DWORD>(WAIT_OBJECT_0));
    DWORD code = 1;
    GetExitCodeProcess(process.Get(), &code);
    EXPECT_EQ(code, 0u);
}

#pragma once
// Helpers for tests that create server objects in this process through the
// server's own class object.
#include "CadroSim.h"
#include "ClassFactory.h"
#include "ComPtr.h"
#include "GroupState.h"
#include "TaskMem.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <string>

// Puts this process's network back as described: tests write to its
// members, and a filter or a shuffle runs them in any order.
inline void ResetNetwork()
{
    BSTR answer = nullptr;
    CadroSim_Execute(L"reset", &answer);
    SysFreeString(answer);
}

inline ComPtr<IOPCServer> CreateInProcServer()
{
    static CServerClassFactory factory;
    ComPtr<IOPCServer> server;
    EXPECT_EQ(factory.CreateInstance(nullptr, IID_IOPCServer, reinterpret_cast<void **>(server.Out())), S_OK);
    return server;
}

struct AddedGroup {
    HRESULT hr = E_FAIL;
    OPCHANDLE handle = 0;
    DWORD revisedRate = 0;
    ComPtr<IOPCGroupStateMgt> group;
};

inline AddedGroup AddGroup(IOPCServer *server, const wchar_t *name, DWORD rate = 1000, BOOL active = FALSE,
                           FLOAT *deadband = nullptr, LONG *bias = nullptr)
{
    AddedGroup g;
    g.hr = server->AddGroup(name, active, rate, 42, bias, deadband, 0x409, &g.handle, &g.revisedRate,
                            IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(g.group.Out()));
    return g;
}

inline DWORD GroupCount(IOPCServer *server)
{
    OPCSERVERSTATUS *status = nullptr;
    if (FAILED(server->GetStatus(&status)))
        return 0xFFFFFFFF;
    DWORD count = status->dwGroupCount;
    CoTaskMemFree(status->szVendorInfo);
    CoTaskMemFree(status);
    return count;
}

inline std::vector<std::wstring> GroupNames(IOPCServer *server, OPCENUMSCOPE scope = OPC_ENUM_ALL)
{
    std::vector<std::wstring> names;
    ComPtr<IEnumString> e;
    if (FAILED(server->CreateGroupEnumerator(scope, IID_IEnumString, reinterpret_cast<IUnknown **>(e.Out()))))
        return names;
    LPOLESTR s = nullptr;
    while (e->Next(1, &s, nullptr) == S_OK) {
        names.emplace_back(s ? s : L"");
        CoTaskMemFree(s);
    }
    return names;
}

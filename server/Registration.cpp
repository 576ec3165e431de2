#include "Registration.h"

#include "ComPtr.h"
#include "RegistryScript.h"
#include "ServerIds.h"

#include <comcat.h>
#include <oleauto.h>

#include <iterator>
#include <string>

namespace {
std::wstring ModulePath()
{
    wchar_t path[MAX_PATH * 4];
    DWORD n = GetModuleFileNameW(nullptr, path, static_cast<DWORD>(std::size(path)));
    return std::wstring(path, n);
}

// The path that LocalServer32 names: the short form when there is one.
HRESULT RegisteredModulePath(std::wstring &out)
{
    std::wstring longPath = ModulePath();
    wchar_t shortPath[MAX_PATH];
    SetLastError(ERROR_SUCCESS);
    DWORD n = GetShortPathNameW(longPath.c_str(), shortPath, MAX_PATH);
    if (n == 0 || GetLastError() == ERROR_INVALID_PARAMETER) {
        out = longPath;
        return S_OK;
    }
    if (n >= MAX_PATH)
        return E_OUTOFMEMORY;
    out.assign(shortPath, n);
    return S_OK;
}

HRESULT RunScript(int id, bool reg)
{
    std::wstring module;
    HRESULT hr = RegisteredModulePath(module);
    if (FAILED(hr))
        return hr;
    CRegistryScript script;
    hr = CRegistryScript::Load(id, module, script);
    if (FAILED(hr))
        return hr;
    if (reg)
        return script.Register();
    script.Unregister();
    return S_OK;
}

ComPtr<ICatRegister> CategoryManager()
{
    ComPtr<ICatRegister> manager;
    CoCreateInstance(CLSID_StdComponentCategoriesMgr, nullptr, CLSCTX_INPROC_SERVER, IID_ICatRegister,
                     reinterpret_cast<void **>(manager.Out()));
    return manager;
}

const CATID kCategories[] = {CATID_OPCDAServer10, CATID_OPCDAServer20};

HRESULT RegisterCategories()
{
    ComPtr<ICatRegister> manager = CategoryManager();
    if (!manager)
        return S_OK; // no manager: the categories are skipped
    for (CATID catid : kCategories) {
        HRESULT hr = manager->RegisterClassImplCategories(CLSID_SkylarcOPCServer, 1, &catid);
        if (FAILED(hr))
            return hr;
    }
    return S_OK;
}

void UnregisterCategories()
{
    ComPtr<ICatRegister> manager = CategoryManager();
    if (!manager)
        return;
    for (CATID catid : kCategories)
        manager->UnRegisterClassImplCategories(CLSID_SkylarcOPCServer, 1, &catid);
}

// The executable carries no type library: unless a ".tlb" lies beside it,
// this fails and its code becomes the registration's result.
HRESULT RegisterTypeLibrary()
{
    std::wstring path = ModulePath();
    ComPtr<ITypeLib> typeLib;
    HRESULT hr = LoadTypeLib(path.c_str(), typeLib.Out());
    if (FAILED(hr)) {
        size_t slash = path.find_last_of(L"\\/");
        size_t dot = path.find_last_of(L'.');
        if (dot == std::wstring::npos || (slash != std::wstring::npos && dot < slash))
            path += L".tlb";
        else
            path.replace(dot, std::wstring::npos, L".tlb");
        hr = LoadTypeLib(path.c_str(), typeLib.Out());
    }
    if (FAILED(hr))
        return hr;
    std::wstring helpDir = path.substr(0, path.find_last_of(L"\\/"));
    return RegisterTypeLib(typeLib.Get(), const_cast<wchar_t *>(path.c_str()), const_cast<wchar_t *>(helpDir.c_str()));
}
} // namespace

HRESULT RegisterServer()
{
    RunScript(IDR_APPID_SCRIPT, true); // its result is not examined
    HRESULT hr = RunScript(IDR_CLASS_SCRIPT, true);
    if (FAILED(hr))
        return hr;
    hr = RegisterCategories();
    if (FAILED(hr))
        return hr;
    return RegisterTypeLibrary();
}

HRESULT UnregisterServer()
{
    RunScript(IDR_APPID_SCRIPT, false);
    RunScript(IDR_CLASS_SCRIPT, false);
    UnregisterCategories();
    return S_OK;
}

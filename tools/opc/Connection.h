#pragma once
// The server opc talks to, and the group it adds its items to.
#include "ComPtr.h"
#include "Output.h"
#include "opcda.h"

#include <string>
#include <vector>

// Exit codes of opc.
enum ExitCode { kExitOk = 0, kExitFailed = 1, kExitUsage = 2, kExitNoServer = 3 };

// How long opc waits for a server to be created, unless --timeout says.
constexpr double kDefaultTimeoutSeconds = 30;

// The server named by a ProgID or a {CLSID}, created out of process.
class Connection {
public:
    static const wchar_t kDefaultServer[];

    // kExitOk, or kExitNoServer with the reason written to out, also when
    // the server has not answered within timeoutSeconds.
    int Open(const std::wstring &name, double timeoutSeconds, Output &out);
    IOPCServer *Server() const { return m_server.Get(); }

    // "<the server's text for code> (0x...)", the system's text when the
    // server has none.
    std::wstring Describe(HRESULT code) const;

    // An activation that fails this way is tried again while time is left:
    // the server was stopping, or went away while it was being reached.
    static bool IsTransient(HRESULT hr);
    // True once opc gave up waiting for a creation that is still running:
    // COM's cleanup would wait for it, so opc must leave without it.
    static bool CreationAbandoned();

private:
    ComPtr<IOPCServer> m_server;
};

// Creates clsid out of process, on host (this machine when empty), and asks
// it for iid; an activation that fails with a transient code (IsTransient)
// is tried again while time is left. E_PENDING when a creation has not
// ended within the timeout.
HRESULT CreateOutOfProcess(const CLSID &clsid, REFIID iid, const std::wstring &host, double timeoutSeconds,
                           ComPtr<IUnknown> &object);

// The system's text for an error code, or empty.
std::wstring SystemErrorText(HRESULT code);

// A private group of the server, removed again when this goes.
class ItemGroup {
public:
    struct Item {
        std::wstring id;
        OPCHANDLE server = 0;
        VARTYPE canonical = VT_EMPTY;
        DWORD access = 0;
        HRESULT error = S_OK;
    };

    ItemGroup() = default;
    ItemGroup(const ItemGroup &) = delete;
    ItemGroup &operator=(const ItemGroup &) = delete;
    ~ItemGroup();

    HRESULT Create(IOPCServer *server, DWORD rate, bool active, float deadband, DWORD *revisedRate = nullptr);
    // Adds every identifier, active, with client handles 0..n-1.
    HRESULT Add(const std::vector<std::wstring> &ids, VARTYPE requested, std::vector<Item> &items);
    // Types and rights of the identifiers, without adding them.
    HRESULT Validate(const std::vector<std::wstring> &ids, std::vector<Item> &items);
    template <class I> HRESULT As(ComPtr<I> &out) const { return m_items.As(out); }
    // Makes the group active (its first scan reports every item at once).
    HRESULT Activate();
    // The handles of the items that were added, and their client handles.
    static void Valid(const std::vector<Item> &items, std::vector<OPCHANDLE> &servers, std::vector<size_t> &which);

private:
    HRESULT AddOrValidate(const std::vector<std::wstring> &ids, VARTYPE requested, bool validateOnly,
                          std::vector<Item> &items);

    IOPCServer *m_server = nullptr;
    OPCHANDLE m_handle = 0;
    ComPtr<IOPCItemMgt> m_items;
};

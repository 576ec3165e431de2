#pragma once
// Entry points of the simulation engine (CadroSim.dll). The five
// vendor-named libraries forward to these; tests, benchmarks and tools use
// the control entry points directly.
#include "CadroNetwork.h"

#include <string>

#ifdef CADROSIM_BUILDING
#define CADROSIM_API extern "C" __declspec(dllexport)
#else
#define CADROSIM_API extern "C" __declspec(dllimport)
#endif

CADROSIM_API bool CadroSim_NewRealTime(ICadroRealTimeReceiver *receiver, CadroRealTime **out);
CADROSIM_API bool CadroSim_NewBrowser(ICadroBrowserReceiver *receiver, CadroBrowser **out);
CADROSIM_API HRESULT CadroSim_HostName(BSTR *out);
CADROSIM_API IUnknown *CadroSim_NewWideText(const wchar_t *text);

// Runs a control command (see cadroctl --help); S_OK when it succeeded,
// S_FALSE with the error text otherwise. The caller frees the answer.
CADROSIM_API HRESULT CadroSim_Execute(const wchar_t *command, BSTR *answer);
// Replaces the network with a description; E_INVALIDARG with a line-numbered
// error (freed by the caller) when it does not parse.
CADROSIM_API HRESULT CadroSim_Load(const wchar_t *description, BSTR *error);

// This process serves a network of its own instead of reaching the network
// node: for the node itself and for tests. Called before any other use.
CADROSIM_API void CadroSim_UseEmbeddedNetwork();
// Serves this process's network to the libraries of other processes until
// "shutdown" or until none has been connected for idleSeconds; the process's
// exit code (1: another node runs already, 3: the port cannot be opened).
// name: the node's pipe, null for the machine's node ("CadroNode"); listen:
// "[host:]port" where the nodes of other machines reach it, or null.
CADROSIM_API int CadroSim_RunNode(unsigned long idleSeconds, const wchar_t *name, const wchar_t *listen);
// Asks a running network node to shut down and waits for it to end: S_OK,
// S_FALSE when none runs, E_FAIL when it did not end.
CADROSIM_API HRESULT CadroSim_StopNode();

// The control pipe of the engine in process processId.
inline std::wstring ControlPipeName(unsigned long processId)
{
    return L"\\\\.\\pipe\\CadroSim-" + std::to_wstring(processId);
}

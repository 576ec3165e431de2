// opc status: the server's OPCSERVERSTATUS.
#include "Commands.h"
#include "Format.h"
#include "TaskMem.h"

namespace {
const wchar_t *StateName(OPCSERVERSTATE state)
{
    switch (state) {
    case OPC_STATUS_RUNNING:
        return L"running";
    case OPC_STATUS_FAILED:
        return L"failed";
    case OPC_STATUS_NOCONFIG:
        return L"no configuration";
    case OPC_STATUS_SUSPENDED:
        return L"suspended";
    case OPC_STATUS_TEST:
        return L"test";
    default:
        return L"unknown";
    }
}
} // namespace

bool CheckStatus(const Arguments &args, Output &out)
{
    if (!args.Positional().empty()) {
        out.Error(L"status takes no arguments");
        return false;
    }
    return true;
}

int ShowStatus(const Arguments &, Output &out, Connection &server)
{
    OPCSERVERSTATUS *raw = nullptr;
    HRESULT hr = server.Server()->GetStatus(&raw);
    TaskMem<OPCSERVERSTATUS> status(raw);
    if (FAILED(hr) || !status) {
        out.Error(L"status: " + server.Describe(FAILED(hr) ? hr : E_FAIL));
        return kExitFailed;
    }
    TaskMem<wchar_t> vendor(status->szVendorInfo);
    std::wstring version = std::to_wstring(status->wMajorVersion) + L"." + std::to_wstring(status->wMinorVersion) +
                           L"." + std::to_wstring(status->wBuildNumber);
    const wchar_t *vendorText = vendor ? vendor.Get() : L"";
    if (out.Json()) {
        out.Line(Output::Object({{L"state", JsonString(StateName(status->dwServerState))},
                                 {L"startTime", JsonString(LocalTimeText(status->ftStartTime))},
                                 {L"currentTime", JsonString(LocalTimeText(status->ftCurrentTime))},
                                 {L"lastUpdateTime", JsonString(LocalTimeText(status->ftLastUpdateTime))},
                                 {L"groupCount", std::to_wstring(status->dwGroupCount)},
                                 {L"bandwidth", std::to_wstring(status->dwBandWidth)},
                                 {L"version", JsonString(version)},
                                 {L"vendor", JsonString(vendorText)}}));
        return kExitOk;
    }
    auto orDash = [](const std::wstring &text) { return text.empty() ? std::wstring(L"-") : text; };
    out.Line(L"state         " + std::wstring(StateName(status->dwServerState)));
    out.Line(L"start time    " + orDash(LocalTimeText(status->ftStartTime)));
    out.Line(L"current time  " + orDash(LocalTimeText(status->ftCurrentTime)));
    out.Line(L"last update   " + orDash(LocalTimeText(status->ftLastUpdateTime)));
    out.Line(L"groups        " + std::to_wstring(status->dwGroupCount));
    out.Line(L"bandwidth     " +
             (status->dwBandWidth == 0xFFFFFFFF ? std::wstring(L"unknown") : std::to_wstring(status->dwBandWidth)));
    out.Line(L"version       " + version);
    out.Line(L"vendor        " + orDash(vendorText));
    return kExitOk;
}

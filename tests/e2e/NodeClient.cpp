// node_client: another process on the network node, as a server's libraries
// are. It subscribes to one member and prints what arrives ("status N",
// "value V") for a number of seconds, or until a given value arrives.
#include "CadroSim.h"
#include "Unknown.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cwchar>

namespace {
class Printer : public CSimUnknown<ICadroRealTimeReceiver> {
public:
    Printer(double last, HANDLE done) : m_last(last), m_done(done) {}
    HRESULT STDMETHODCALLTYPE OnData(void *, uint32_t flags, const CadroValue *value, int32_t, uint32_t,
                                     uint32_t) override
    {
        if ((flags & kCadroHasValue) && value->type == kCadroNumber) {
            printf("value %.17g\n", value->number);
            if (value->number == m_last)
                SetEvent(m_done);
        }
        fflush(stdout);
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE OnAttributes(void *, const CadroAttributes *) override { return S_OK; }
    HRESULT STDMETHODCALLTYPE StatusChange(void *, uint32_t status, uint32_t, uint32_t) override
    {
        printf("status %u\n", status);
        fflush(stdout);
        return S_OK;
    }

private:
    double m_last;
    HANDLE m_done;
};
} // namespace

int wmain(int argc, wchar_t **argv)
{
    if (argc != 3 && argc != 4) {
        fwprintf(stderr, L"usage: node_client <member url> <seconds> [<last value>]\n");
        return 2;
    }
    HANDLE done = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    Printer *printer = new Printer(argc == 4 ? _wtof(argv[3]) : NAN, done);
    CadroRealTime *realTime = nullptr;
    if (!CadroSim_NewRealTime(printer, &realTime)) {
        printer->Release();
        return 1;
    }
    SubscribeOptions options = {13, 7, 0, 0, 0};
    CadroDataItem *item = nullptr;
    HRESULT hr = realTime->Subscribe(argv[1], printer, &options, &item);
    printf("subscribed 0x%08lX\n", static_cast<unsigned long>(hr));
    fflush(stdout);
    WaitForSingleObject(done, wcstoul(argv[2], nullptr, 10) * 1000);
    if (item)
        item->Release();
    realTime->Release();
    printer->Release();
    CloseHandle(done);
    return SUCCEEDED(hr) ? 0 : 1;
}

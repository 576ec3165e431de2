#include "InterfaceAnchor.h"

// The inert object: it answers a query for IUnknown or an interface it is
// anchoring with itself (never for the ones COM asks about on its own, such
// as IMarshal), and every method beyond IUnknown's refuses. Its stubs'
// marshals never leave the process, so no client holds a reference through
// which to call them; the refusal is there for a caller that guesses an
// interface pointer identifier.
// One entry serves every method because the x64 calling convention leaves
// the arguments to the caller: a method that reads none of them may stand in
// for any signature.
static_assert(sizeof(void *) == 8, "the inert vtable relies on the x64 calling convention");

struct CInterfaceAnchor::Inert {
    static constexpr int kMethods = 64; // beyond the largest exported interface
    using Method = void *;

    static HRESULT STDMETHODCALLTYPE QueryInterface(Inert *self, REFIID riid, void **ppv)
    {
        if (!ppv)
            return E_POINTER;
        *ppv = self->Answers(riid) ? self : nullptr;
        return *ppv ? S_OK : E_NOINTERFACE;
    }
    // The anchor owns the object; COM's counts only matter for balance.
    static ULONG STDMETHODCALLTYPE AddRef(Inert *) { return 2; }
    static ULONG STDMETHODCALLTYPE Release(Inert *) { return 1; }
    static HRESULT STDMETHODCALLTYPE Refuse(Inert *) { return E_UNEXPECTED; }

    Inert()
    {
        table[0] = reinterpret_cast<Method>(&QueryInterface);
        table[1] = reinterpret_cast<Method>(&AddRef);
        table[2] = reinterpret_cast<Method>(&Release);
        for (int i = 3; i < kMethods; ++i)
            table[i] = reinterpret_cast<Method>(&Refuse);
    }
    IUnknown *Unknown() { return reinterpret_cast<IUnknown *>(this); }
    bool Answers(REFIID riid) const
    {
        if (IsEqualIID(riid, IID_IUnknown))
            return true;
        for (const IID &iid : answered)
            if (IsEqualIID(riid, iid))
                return true;
        return false;
    }

    const Method *vtable = table; // first member: the object's interface pointer
    Method table[kMethods];
    std::vector<IID> answered; // only grows while the anchor holds
};

CInterfaceAnchor::CInterfaceAnchor() : m_inert(std::make_unique<Inert>()) {}

CInterfaceAnchor::~CInterfaceAnchor()
{
    Release();
}

HRESULT CInterfaceAnchor::Hold(const std::vector<const IID *> &iids)
{
    HRESULT result = HoldOne(IID_IUnknown);
    for (const IID *iid : iids) {
        HRESULT hr = HoldOne(*iid);
        if (SUCCEEDED(result))
            result = hr;
    }
    return result;
}

HRESULT CInterfaceAnchor::HoldOne(REFIID iid)
{
    IStream *raw = nullptr;
    HRESULT hr = CreateStreamOnHGlobal(nullptr, TRUE, &raw);
    if (FAILED(hr))
        return hr;
    ComPtr<IStream> stream = ComPtr<IStream>::Attach(raw);
    if (!m_inert->Answers(iid))
        m_inert->answered.push_back(iid); // COM queries for it while marshalling
    hr = CoMarshalInterface(stream.Get(), iid, m_inert->Unknown(), MSHCTX_LOCAL, nullptr, MSHLFLAGS_TABLESTRONG);
    if (SUCCEEDED(hr))
        m_marshals.push_back(std::move(stream));
    return hr;
}

void CInterfaceAnchor::Release()
{
    for (ComPtr<IStream> &stream : m_marshals) {
        LARGE_INTEGER start = {};
        stream->Seek(start, STREAM_SEEK_SET, nullptr);
        CoReleaseMarshalData(stream.Get());
    }
    m_marshals.clear();
}

#pragma once
// One client call's pass over the address space. While a CCallPass lives on
// a thread, work that may be shared by every item of the call is done once:
// each address-space node reads its children from the network at most once
// per pass. The next call begins a new pass and reads them again, so the
// network's changes are seen call by call. Passes nest: an inner CCallPass
// (a call made inside another one) joins the outer pass.
#include <cstdint>

class CCallPass {
public:
    CCallPass();
    ~CCallPass();
    CCallPass(const CCallPass &) = delete;
    CCallPass &operator=(const CCallPass &) = delete;

    // The pass running on this thread; 0 when none (every refresh reads).
    static uint64_t Current();

private:
    bool m_outermost;
};

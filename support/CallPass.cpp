#include "CallPass.h"

#include <atomic>

namespace {
std::atomic<uint64_t> g_lastPass{0};
thread_local uint64_t t_currentPass = 0;
} // namespace

CCallPass::CCallPass() : m_outermost(t_currentPass == 0)
{
    if (m_outermost)
        t_currentPass = ++g_lastPass;
}

CCallPass::~CCallPass()
{
    if (m_outermost)
        t_currentPass = 0;
}

uint64_t CCallPass::Current()
{
    return t_currentPass;
}

#include "FailingAllocations.h"

#include <cstdlib>
#include <new>

namespace {
thread_local long t_successesLeft = -1;
thread_local bool t_fired = false;
} // namespace

void FailingAllocations::Arm(long successes)
{
    t_successesLeft = successes;
    t_fired = false;
}

void FailingAllocations::Disarm()
{
    t_successesLeft = -1;
}

bool FailingAllocations::Fired()
{
    return t_fired;
}

void *operator new(std::size_t size)
{
    if (t_successesLeft >= 0 && t_successesLeft-- == 0) {
        t_fired = true;
        throw std::bad_alloc();
    }
    if (void *p = std::malloc(size ? size : 1))
        return p;
    throw std::bad_alloc();
}

void *operator new(std::size_t size, const std::nothrow_t &) noexcept
{
    try {
        return ::operator new(size);
    } catch (const std::bad_alloc &) {
        return nullptr;
    }
}

void operator delete(void *p) noexcept
{
    std::free(p);
}

void operator delete(void *p, std::size_t) noexcept
{
    std::free(p);
}

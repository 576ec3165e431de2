#include "LockOrder.h"

#include "Trace.h"

#include <algorithm>
#include <vector>

namespace {
struct Held {
    const void *lock;
    LockOrder::Level level;
};
// The checked locks this thread holds, in the order taken (a recursive
// acquisition appears again).
thread_local std::vector<Held> t_held;
} // namespace

bool LockOrder::Acquire(const void *lock, Level level)
{
    bool ok = true;
    if (level != Unchecked) {
        bool heldAlready = std::any_of(t_held.begin(), t_held.end(), [lock](const Held &h) { return h.lock == lock; });
        if (!heldAlready)
            for (const Held &h : t_held)
                if (h.level >= level) {
                    ok = false;
                    break;
                }
    }
    t_held.push_back({lock, level});
    if (!ok)
        INTERNAL_ASSERT_FAILED("lock order: a lock taken after one of its level or a later one");
    return ok;
}

void LockOrder::Release(const void *lock)
{
    for (auto it = t_held.rbegin(); it != t_held.rend(); ++it)
        if (it->lock == lock) {
            t_held.erase(std::next(it).base());
            return;
        }
}

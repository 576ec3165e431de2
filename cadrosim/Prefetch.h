#pragma once
// Asking for memory before it is read. A tick or a batch of values reaches
// thousands of objects scattered in the heap (members, subscriptions,
// feeds), each a cache miss that costs more than the work done on it: the
// loops over them ask for the objects a few entries ahead.

namespace cadrosim {

// Entries between asking for an object and reading it.
constexpr unsigned kPrefetchAhead = 4;

// The first two cache lines of an object (nothing hot is kept past them).
inline void PrefetchObject(const void *p)
{
    __builtin_prefetch(p);
    __builtin_prefetch(static_cast<const char *>(p) + 64);
}

} // namespace cadrosim

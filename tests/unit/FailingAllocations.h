#pragma once
// Makes the Nth allocation of this thread fail, for tests of what an
// operation leaves behind when memory runs out part-way. The test program
// replaces the global allocation functions; other threads never fail.
namespace FailingAllocations {
// Fails the allocation after `successes` more have succeeded; -1 disarms.
void Arm(long successes);
void Disarm();
// Whether the allocation armed for failed (a call that never reached it
// made fewer allocations).
bool Fired();
} // namespace FailingAllocations

// The test programs' own operator new and delete.
//
// Every block is filled with 0xDD when it is freed, so that code which reads
// freed memory follows a poisoned pointer and faults at once instead of
// reading whatever the heap left there. And a thread may ask for one of its
// own allocations to fail, as it would when memory runs out: the other
// threads of the process allocate as usual.
#pragma once

#include <cstddef>

namespace test_heap {

// The `n`-th allocation through operator new on the calling thread from now
// on throws std::bad_alloc (or gives null, for the nothrow forms); 1 is the
// very next one. 0 disarms.
void fail_nth(std::size_t n);
// True once the failure asked for by the last fail_nth has happened.
bool failed();

}  // namespace test_heap

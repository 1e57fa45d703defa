// A count of the program's heap allocations, for tests that check a path
// allocates nothing: every test program replaces the global allocation
// functions with counting ones.
#ifndef ZORVNOTIFYD_TESTS_SUPPORT_ALLOCATION_COUNT_H_
#define ZORVNOTIFYD_TESTS_SUPPORT_ALLOCATION_COUNT_H_

namespace zorv_test {

// The number of calls of the global operator new (and of the array form,
// which reaches it) in this process so far.
long Allocations();

}  // namespace zorv_test

#endif  // ZORVNOTIFYD_TESTS_SUPPORT_ALLOCATION_COUNT_H_

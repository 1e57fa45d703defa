// Export macro for the public API of libzorvnotifyd.
//
// The library is built with hidden visibility; only declarations marked
// ZORVNOTIFYD_EXPORT are visible to programs that link it.  The macro is
// harmless in programs that include the headers.
#ifndef ZORVNOTIFYD_EXPORT_H_
#define ZORVNOTIFYD_EXPORT_H_

#if defined(__GNUC__) || defined(__clang__)
#define ZORVNOTIFYD_EXPORT __attribute__((visibility("default")))
#else
#define ZORVNOTIFYD_EXPORT
#endif

#endif  // ZORVNOTIFYD_EXPORT_H_

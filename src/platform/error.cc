// The platform's last-error record, kept per thread so that concurrent
// callers never read each other's failures.

#include "platform/platform.h"

namespace {

thread_local unsigned int last_code = 0;
thread_local const char* last_file = "";
thread_local int last_line = 0;

}  // namespace

namespace ZORV {
namespace ZORVNOTIFYD {
namespace platform {

void SetLastError(unsigned int code, const char* file, int line) {
  last_code = code;
  last_file = file != nullptr ? file : "";
  last_line = line;
}

}  // namespace platform
}  // namespace ZORVNOTIFYD
}  // namespace ZORV

unsigned int ZORBCErrGet() { return last_code; }

const char* ZORBCErrorGetFile() { return last_file; }

int ZORBCErrorGetLine() { return last_line; }

#include <ldtr.h>

#include <cstdio>

// The number and the trace class are the program's own.
static long work(long input) {
  ldtr_function_local<0x3F010100, 33, LDTR_EVENT_CLASS_33> trace(nullptr);
  if (ldtr_traces(LDTR_EVENT_CLASS_33)) trace(ldtr_entry_type(33))();
  if (input < 0) {
    if (ldtr_traces(LDTR_EVENT_DEBUG)) {
      trace(LDTR_TYPE_DEBUG).debug(LDTR_LEVEL_ERROR, "work: %ld is negative\n", input);
    }
    return trace.SetErrorCode(-1);  // the exit record has the code
  }
  return trace.SetErrorCode(0);
}

int main() {
  std::printf("%ld %ld\n", work(1), work(-1));
  return 0;
}

// Prints:
// 0 -1

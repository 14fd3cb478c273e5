// The least that a function can do, with the frame and without.
#include "trace_scope.h"

using namespace osutils;

extern "C" __attribute__((visibility("default"))) int without_frame(int argument) {
  return argument;
}

extern "C" __attribute__((visibility("default"))) int with_frame(int argument) {
  TraceScope<traced::getEnvVar> trace;
  return trace.result(argument);
}

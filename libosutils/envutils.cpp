// Environment variables, through liborxldap, so that it and the tools share one environment.

#include "osutils.h"
#include "platform.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::TraceScope;

TRACED char* getEnvVar(const char* name) {
  TraceScope<traced::getEnvVar> trace;

  if (name == nullptr) {
    DEBUG_MESSAGE(trace, "getEnvVar: passed a null pointer.\n");
    return nullptr;
  }
  return ldap_getenv(name);
}

TRACED int putEnvVar(char* name, const char* value) {
  TraceScope<traced::putEnvVar> trace;

  if (name == nullptr || value == nullptr) {
    // sic: getEnvVar's text.
    DEBUG_MESSAGE(trace, "getEnvVar: passed a null pointer.\n");
    return trace.result(OSUTILS_PARAM_ERROR);
  }

  char* assignment = nullptr;
  if (vra_asprintf(&assignment, "%s=%s", name, value) == -1) {
    DEBUG_MESSAGE(trace, "putEnvVar: vra_asprintf failed\n");
    return trace.result(OSUTILS_NO_MEMORY);
  }
  // sic: leaked deliberately, also after a failure, because the platform may keep the pointer.
  const int rc = ldap_putenv(assignment);
  if (rc != 0) {
    DEBUG_MESSAGE(trace, "putEnvVar: putenv retured rc=%d.\n", rc);  // sic: "retured"
    return trace.result(OSUTILS_OPERATIONS_ERROR);
  }
  return trace.result(OSUTILS_SUCCESS);
}

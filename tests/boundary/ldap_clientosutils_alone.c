/* A client of ldap_clientosutils.h alone: its header declares all it needs. */
#include <ldap_clientosutils.h>
/* a second inclusion changes nothing */
#include <assert.h>
#include <ldap_clientosutils.h>

static_assert(OSUTILS_PARAM_ERROR == 89, "result codes");
static_assert(sizeof(struct hostent) == 32, "what copyHostent begins with");

/* A client of both headers, in either order (LDAP_FIRST): the LDAP header's numbers are its own, and ours
 * stay what they are. */
/* The order is what is tested. */
/* clang-format off */
#ifdef LDAP_FIRST
#include <ldap.h>
#endif
#include <osutils.h>
#include <ldap.h>
/* clang-format on */

#include <assert.h>

static_assert(LDAP_SUCCESS == 0 && LDAP_NO_SUCH_OBJECT == 32, "the same in both");
static_assert(LDAP_PARAM_ERROR == -9 && LDAP_NO_MEMORY == -10, "the LDAP header's own numbers");

static_assert(OSUTILS_SUCCESS == 0 && OSUTILS_OPERATIONS_ERROR == 1, "result codes");
static_assert(OSUTILS_CONSTRAINT_VIOLATION == 19 && OSUTILS_NO_SUCH_OBJECT == 32, "result codes");
static_assert(OSUTILS_INVALID_CREDENTIALS == 49 && OSUTILS_INSUFFICIENT_ACCESS == 50,
              "result codes");
static_assert(OSUTILS_UNAVAILABLE == 52 && OSUTILS_UNWILLING_TO_PERFORM == 53, "result codes");
static_assert(OSUTILS_ALREADY_EXISTS == 68 && OSUTILS_OTHER == 80, "result codes");
static_assert(OSUTILS_PARAM_ERROR == 89 && OSUTILS_NO_MEMORY == 90, "result codes");

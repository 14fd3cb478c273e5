/* A client of osutils.h alone: its header declares all it needs, and gives the customary spellings. */
#include <osutils.h>
/* a second inclusion changes nothing */
#include <assert.h>
#include <osutils.h>

static_assert(LDAP_SUCCESS == 0 && LDAP_OPERATIONS_ERROR == 1, "result codes");
static_assert(LDAP_CONSTRAINT_VIOLATION == 19 && LDAP_NO_SUCH_OBJECT == 32, "result codes");
static_assert(LDAP_INVALID_CREDENTIALS == 49 && LDAP_INSUFFICIENT_ACCESS == 50, "result codes");
static_assert(LDAP_UNAVAILABLE == 52 && LDAP_UNWILLING_TO_PERFORM == 53, "result codes");
static_assert(LDAP_ALREADY_EXISTS == 68 && LDAP_OTHER == 80, "result codes");
static_assert(LDAP_PARAM_ERROR == 89 && LDAP_NO_MEMORY == 90, "result codes");
#if OSUTILS_VERSION_MAJOR < 6 || OSUTILS_VERSION_MINOR < 0 || OSUTILS_VERSION_PATCH < 0
#error "the version is not made of numbers that the preprocessor can compare"
#endif
static_assert(sizeof(OSUTILS_VERSION) >= sizeof("6.1.0"), "the version is text");
static_assert(FILE_DESC_USE_PATH == -9999 && FILE_DESC_USE_LINK_PATH == -8888, "selectors");
static_assert(ADMIN_LOG_XQ4 == 0 && ADMIN_LOG_XQ4_CMDS == 1 && ADMIN_LOG_ADM == 2, "log files");
static_assert(sizeof(g_isCallerVraImigr) == 1 && sizeof(g_loadLocalXQ4Path) == 1, "flags");
static_assert(sizeof(doesFileExist("")) == 1, "a flag is one byte");

#ifdef __cplusplus
/* The layouts that clients are compiled with. */
static_assert(sizeof(VRAOSUtils::EtcServices) == 24, "virtual table, two pointers");
static_assert(sizeof(VRAOSUtils::ServicesEntry) == 104, "name, port, next");
static_assert(sizeof(VRAOSUtils::EtcInittab) == 24, "virtual table, two pointers");
static_assert(sizeof(VRAOSUtils::InittabEntry) == 320, "four fields, next");
static_assert(VRAOSUtils::EtcServices::ETC_SERVICE_MIN_PORT == 1, "lowest port");
static_assert(VRAOSUtils::EtcServices::ETC_SERVICE_MAX_PORT == 400000, "highest port");
static_assert(VRAOSUtils::EtcServices::INIT_PORT_INDEX == 3700, "first port to try");
static_assert(VRAOSUtils::EtcServices::INIT_PORT_INDEX_INTERRUPT == 3701, "first port to try");
#endif

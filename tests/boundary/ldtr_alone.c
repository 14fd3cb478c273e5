/* A client of ldtr.h alone. */
#include <ldtr.h>
/* a second inclusion changes nothing */
#include <ldtr.h>

#ifdef __cplusplus
/* The layouts that clients are compiled with. */
using Scope = ldtr_function_local<0x3E010100, 33, LDTR_EVENT_CLASS_33>;
static_assert(sizeof(Scope) == 16, "code, object");
static_assert(sizeof(ldtr_function_global) == 8, "code");
static_assert(sizeof(ldtr_formater_local) == 24, "id, type, object");
static_assert(sizeof(ldtr_formater_global) == 8, "type");
static_assert(sizeof(AutoLock) == 16, "virtual table, mutex");
static_assert(sizeof(AutoFree<char>) == 24 + sizeof(pthread_mutex_t),
              "virtual table, pointer, release function, mutex");
#endif

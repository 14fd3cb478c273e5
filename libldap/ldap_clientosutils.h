/* Resolver look-ups whose results are the caller's own, so that threads share no static buffer.
 * Compiles as C11 and as C++17 or later.
 *
 * The functions leave no trace records. vra_getnameinfo, vra_gethostbyname and vra_gethostbyaddr
 * print failures through the platform's debug printer when read_ldap_debug() answers yes. Any
 * thread may call; a thread that is cancelled inside a call ends at its next cancellation point
 * after it; no exception leaves any function. The int answers are OSUTILS_* codes of osutils.h
 * unless said otherwise. */
#ifndef LDAP_CLIENTOSUTILS_H
#define LDAP_CLIENTOSUTILS_H

#include <netdb.h>
#include <sys/socket.h>

#include "osutils.h"

#ifdef __cplusplus
extern "C" {
#endif

/* The host name and the service name of a socket address, as getnameinfo() finds them. `host` or
 * `serv` may be null, but not both: what is asked for comes as a new string, released with free().
 * OSUTILS_OPERATIONS_ERROR when the look-up fails, OSUTILS_PARAM_ERROR for a null or empty address
 * or without an output, OSUTILS_NO_MEMORY. The outputs are null after a failed look-up, untouched
 * after OSUTILS_PARAM_ERROR, null or untouched after OSUTILS_NO_MEMORY. */
OSUTILS_API int vra_getnameinfo(const struct sockaddr* addr, socklen_t addrlen, char** host,
                                char** serv);
/* The host entry of a name, in one new block of 1024 bytes, `*size`, that begins with the structure
 * and is released with one free(). An answer that does not fit fails. OSUTILS_PARAM_ERROR when an
 * output is null, OSUTILS_NO_MEMORY, otherwise the resolver's code (NO_RECOVERY, TRY_AGAIN, or
 * NETDB_INTERNAL, as for an answer that does not fit). After any failure but OSUTILS_PARAM_ERROR,
 * which leaves the outputs untouched, `*result` is null and `*size` 0.
 *
 * A name that is not found may answer 0 as well. The structure is then what the resolver left in
 * it: all zero, or a host of the hosts file that has nothing to do with the name. So do not use an
 * entry before you know that the name is found, for instance from getaddrinfo(); a null h_name says
 * that it is not. `name` is not checked and must not be null. */
OSUTILS_API int vra_gethostbyname(const char* name, struct hostent** result, int* size);
/* The host entry of an address of `len` bytes, likewise. `addr` must not be null. */
OSUTILS_API int vra_gethostbyaddr(const void* addr, socklen_t len, int type,
                                  struct hostent** result, int* size);

#ifdef __cplusplus
} /* extern "C" */

/* How many bytes copyHostent() fills, less the one that it writes for a null name: allocate one
 * more for a name that may be null. 0 for a null pointer. */
OSUTILS_API int calcHostentSize(hostent* h);
/* Copies `src`, its strings and its addresses into the block that `dst` begins: the structure, the
 * name (empty for null), the aliases, the addresses, without padding. So the copy's pointer arrays
 * are aligned by chance only: read them with memcpy(). Neither `src` and its arrays nor `dst` need
 * be aligned; null arrays count as empty. Addresses are copied, and counted by calcHostentSize(),
 * as strings: up to the first zero byte, which must be there, in the address or behind it; h_length
 * is not looked at. OSUTILS_SUCCESS, or 1 when a pointer is null. */
OSUTILS_API int copyHostent(hostent* src, hostent* dst);
#endif /* __cplusplus */

#endif /* LDAP_CLIENTOSUTILS_H */

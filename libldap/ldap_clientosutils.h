/* Resolver look-ups whose results are the caller's own, so that threads share no static buffer.
 * Compiles as C11 and as C++17 or later.
 *
 * Rules for this header; a function's own comment says only what differs.
 *   int      an OSUTILS_* result code of osutils.h
 *   threads  MT-Safe: any thread may call
 *   cancel   a thread that is cancelled during a call ends at its next cancellation point after the
 *            call
 *   failure  no exception leaves any function
 *   tracing  the functions leave no records. vra_getnameinfo, vra_gethostbyname and
 *            vra_gethostbyaddr print failures through the platform's debug printer if
 *            read_ldap_debug() says so. */
#ifndef LDAP_CLIENTOSUTILS_H
#define LDAP_CLIENTOSUTILS_H

#include <netdb.h>
#include <sys/socket.h>

#include "osutils.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Finds the host name and the service name of a socket address, as getnameinfo() does. `host` or
 * `serv` may be null, but not both; each is a new string.
 * Returns:
 *   - OSUTILS_OPERATIONS_ERROR: the look-up failed
 *   - OSUTILS_PARAM_ERROR: the address is null or empty, or both outputs are null
 *   - OSUTILS_NO_MEMORY: memory ran out
 * After failure: the outputs are null after a failed look-up, untouched after OSUTILS_PARAM_ERROR,
 *   and either after OSUTILS_NO_MEMORY.
 * Frees: the caller frees `*host` and `*serv`.
 * Threads: MT-Safe env locale. */
OSUTILS_API int vra_getnameinfo(const struct sockaddr* addr, socklen_t addrlen, char** host,
                                char** serv);
/* Finds the host entry of a name. `*result` is one new block of 1024 bytes, `*size`, that begins
 * with the structure. `name` must not be null: it is not checked.
 * Returns:
 *   - 0: found, or not found. For a name that is not found the structure is all zero, or a host of
 *     the hosts file that has nothing to do with the name. Do not use it before you know that the
 *     name exists, for instance from getaddrinfo(). A null h_name means not found.
 *   - OSUTILS_PARAM_ERROR: an output is null
 *   - OSUTILS_NO_MEMORY: memory ran out
 *   - NO_RECOVERY, TRY_AGAIN: the resolver failed
 *   - NETDB_INTERNAL: the resolver failed, or the answer does not fit into the block
 * After failure: `*result` is null and `*size` 0; after OSUTILS_PARAM_ERROR both are untouched.
 * Frees: the caller frees `*result` with one free().
 * Threads: MT-Safe env locale. */
OSUTILS_API int vra_gethostbyname(const char* name, struct hostent** result, int* size);
/* Finds the host entry of an address of `len` bytes. `addr` must not be null: it is not checked.
 * Returns: as vra_gethostbyname.
 * After failure: as after vra_gethostbyname.
 * Frees: the caller frees `*result` with one free().
 * Threads: MT-Safe env locale. */
OSUTILS_API int vra_gethostbyaddr(const void* addr, socklen_t len, int type,
                                  struct hostent** result, int* size);

#ifdef __cplusplus
} /* extern "C" */

/* How many bytes copyHostent() fills, less the one that it writes for a null name: allocate one
 * more if the name may be null. 0 for a null pointer. */
OSUTILS_API int calcHostentSize(hostent* h);
/* Copies `src` into the block that begins at `dst`: structure, name (empty for null), aliases and
 * addresses, without padding. Nothing has to be aligned: read the copy's arrays with memcpy(). Null
 * arrays count as empty. Addresses are strings here, as for calcHostentSize(): each ends with its
 * first zero byte, which must be there, in the address or after it. h_length is ignored.
 * Returns:
 *   - 0: the copy was made
 *   - 1: a pointer is null */
OSUTILS_API int copyHostent(hostent* src, hostent* dst);
#endif /* __cplusplus */

#endif /* LDAP_CLIENTOSUTILS_H */

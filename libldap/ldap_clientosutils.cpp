// Resolver look-ups whose results belong to the caller.

#include "ldap_clientosutils.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>

#include "cancellation.h"
#include "ldtr.h"
#include "owned.h"
#include "platform.h"

using osutils::CancellationState;
using osutils::OwnedString;

// Prints if read_ldap_debug() is not 0. A macro, so that the compiler checks the arguments.
#define PRINT_ERROR(...)                                                   \
  do {                                                                     \
    if (read_ldap_debug() != 0) PrintDebug(LDTR_LEVEL_ERROR, __VA_ARGS__); \
  } while (false)

namespace {

constexpr int kBlockBytes = 1024;

// Fills a new block, which holds the structure and after it the resolver's work buffer.
//   function, resolver  names in the messages
//   malloc_ending       end of the message that memory ran out
//   look_up             calls the resolver with the arguments that it gets
template <typename LookUp>
int lookUpHost(const char* function, const char* resolver, const char* malloc_ending,
               hostent** result, int* size, LookUp look_up) {
  if (result == nullptr || size == nullptr) return OSUTILS_PARAM_ERROR;

  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);
  *result = nullptr;
  *size = 0;
  OwnedString block(static_cast<char*>(calloc(1, kBlockBytes)));
  if (!block) {
    PRINT_ERROR("Error - %s: malloc failed%s\n", function, malloc_ending);
    return OSUTILS_NO_MEMORY;
  }

  hostent* const entry = reinterpret_cast<hostent*>(block.get());
  hostent* found = nullptr;
  int error_code = NETDB_INTERNAL;
  if (look_up(entry, block.get() + sizeof *entry, kBlockBytes - sizeof *entry, &found,
              &error_code) != 0) {
    // sic: a blank after the newline.
    PRINT_ERROR("Error - %s: %s failed, errno=%d\n ", function, resolver, error_code);
    return error_code;
  }
  // sic: `found` is not checked.
  *result = reinterpret_cast<hostent*>(block.release());
  *size = kBlockBytes;
  return OSUTILS_SUCCESS;
}

// `from` need not be aligned.
hostent loadUnaligned(const hostent* from) {
  hostent value;
  memcpy(&value, reinterpret_cast<const char*>(from), sizeof value);
  return value;
}

// Returns entry `i` of a null-terminated list, or null for a null list. The list need not be
// aligned, as in a copy by copyHostent.
char* entryAt(char** list, size_t i) {
  if (list == nullptr) return nullptr;
  char* entry;
  memcpy(&entry, reinterpret_cast<const char*>(list) + i * sizeof entry, sizeof entry);
  return entry;
}

// The size of the array, with its null entry, and of the strings.
size_t listSize(char** list) {
  size_t size = sizeof(char*);
  for (size_t i = 0; const char* const entry = entryAt(list, i); ++i) {
    size += sizeof entry + strlen(entry) + 1;
  }
  return size;
}

// Copies the string to `position`, advances `position` and returns the copy.
char* appendString(char*& position, const char* string) {
  char* const copy = position;
  const size_t size = strlen(string) + 1;
  memcpy(copy, string, size);
  position += size;
  return copy;
}

// Does the same with the array and then the strings.
char** appendList(char*& position, char** list) {
  char* const array = position;
  size_t entries = 0;
  while (entryAt(list, entries) != nullptr) ++entries;
  const size_t array_size = (entries + 1) * sizeof(char*);
  memset(array, 0, array_size);
  position += array_size;
  for (size_t i = 0; i < entries; ++i) {
    const char* const copy = appendString(position, entryAt(list, i));
    memcpy(array + i * sizeof copy, &copy, sizeof copy);
  }
  return reinterpret_cast<char**>(array);
}

}  // namespace

int calcHostentSize(hostent* h) {
  if (h == nullptr) return 0;

  const hostent host = loadUnaligned(h);
  // sic: 0 for a null name, although copyHostent writes one byte for it.
  const size_t name_size = host.h_name != nullptr ? strlen(host.h_name) + 1 : 0;
  return static_cast<int>(sizeof host + name_size + listSize(host.h_aliases) +
                          listSize(host.h_addr_list));
}

int copyHostent(hostent* src, hostent* dst) {
  if (src == nullptr || dst == nullptr) return 1;

  char* const block = reinterpret_cast<char*>(dst);
  char* position = block + sizeof *dst;
  hostent copy = loadUnaligned(src);
  copy.h_name = appendString(position, copy.h_name != nullptr ? copy.h_name : "");
  copy.h_aliases = appendList(position, copy.h_aliases);
  // sic: addresses are copied as strings, up to their first zero byte.
  copy.h_addr_list = appendList(position, copy.h_addr_list);
  memcpy(block, &copy, sizeof copy);
  return OSUTILS_SUCCESS;
}

int vra_getnameinfo(const sockaddr* addr, socklen_t addrlen, char** host, char** serv) {
  if (addr == nullptr || addrlen == 0 || (host == nullptr && serv == nullptr)) {
    return OSUTILS_PARAM_ERROR;
  }

  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);
  OwnedString host_text;
  if (host != nullptr) {
    *host = nullptr;
    host_text.reset(static_cast<char*>(malloc(NI_MAXHOST)));
    if (!host_text) return OSUTILS_NO_MEMORY;
  }
  OwnedString serv_text;
  if (serv != nullptr) {
    *serv = nullptr;
    serv_text.reset(static_cast<char*>(malloc(NI_MAXSERV)));
    if (!serv_text) return OSUTILS_NO_MEMORY;
  }

  if (getnameinfo(addr, addrlen, host_text.get(), host_text ? NI_MAXHOST : 0, serv_text.get(),
                  serv_text ? NI_MAXSERV : 0, 0) != 0) {
    // sic: errno, not getnameinfo's code, although few failures set errno.
    const int error = errno;
    PRINT_ERROR("vra_getnameinfo: getnameinfo failed with errno %d\n", error);
    return OSUTILS_OPERATIONS_ERROR;
  }

  if (host != nullptr) *host = host_text.release();
  if (serv != nullptr) *serv = serv_text.release();
  return OSUTILS_SUCCESS;
}

int vra_gethostbyname(const char* name, hostent** result, int* size) {
  return lookUpHost("vra_gethostbyname", "gethostbyname_r", ". ", result, size,
                    [name](auto... outputs) { return gethostbyname_r(name, outputs...); });
}

int vra_gethostbyaddr(const void* addr, socklen_t len, int type, hostent** result, int* size) {
  return lookUpHost("vra_gethostbyaddr", "gethostbyaddr_r", "", result, size,
                    [=](auto... outputs) { return gethostbyaddr_r(addr, len, type, outputs...); });
}

// The addresses of this host, and whether an address is among them.

#include <arpa/inet.h>
#include <errno.h>
#include <net/if.h>
#include <netdb.h>
#include <netinet/in.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <strings.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include "cancellation.h"
#include "osutils.h"
#include "owned.h"
#include "platform.h"
#include "text.h"
#include "trace_scope.h"

namespace traced = osutils::traced;
using osutils::CancellationState;
using osutils::isNullOrEmpty;
using osutils::OwnedList;
using osutils::TraceScope;

namespace {

constexpr size_t kHostNameBytes = 65;
constexpr size_t kAddressBytes = 47;
constexpr size_t kInterfaceBufferBytes = 1024;
constexpr size_t kMaxInterfaces = 10;

struct AddressesDeleter {
  void operator()(addrinfo* addresses) const noexcept { freeaddrinfo(addresses); }
};
using OwnedAddresses = std::unique_ptr<addrinfo, AddressesDeleter>;

// sic: one entry larger than `count` entries and the null entry need.
OwnedList newList(size_t count) {
  return OwnedList(static_cast<char**>(calloc(count + 2, sizeof(char*))));
}

bool equalsIgnoringCase(const char* entry, const char* address) {
  const size_t length = strlen(address);
  return strncasecmp(entry, address, length) == 0 && strlen(entry) == length;
}

// Lists the resolver's addresses of the name.
// sic: every message names getAllIPAddresses and getaddrinfo.
template <typename Trace>
int resolveAddresses(Trace& trace, const char* name, char*** list, int* count) {
  // A thread cancelled in gethostbyname() would leave the C library's mutex locked.
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);
  // sic: the result is ignored, but name services see this request too.
  (void)gethostbyname(name);

  addrinfo hints = {};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* found = nullptr;
  int rc = getaddrinfo(name, nullptr, &hints, &found);
  if (rc != 0) {
    DEBUG_MESSAGE(trace, "getAllIPAddresses: getaddrinfo failed with error %d: %s\n", rc,
                  gai_strerror(rc));
    return rc == EAI_NODATA ? 0 : rc;  // sic: a name without an address is a success
  }
  const OwnedAddresses addresses(found);

  size_t total = 0;
  for (const addrinfo* address = found; address != nullptr; address = address->ai_next) ++total;
  OwnedList texts = newList(total);
  if (!texts) return EAI_MEMORY;

  size_t filled = 0;
  for (const addrinfo* address = found; address != nullptr; address = address->ai_next) {
    char text[kAddressBytes];
    rc = getnameinfo(address->ai_addr, address->ai_addrlen, text, sizeof text, nullptr, 0,
                     NI_NUMERICHOST);
    if (rc != 0) {
      DEBUG_MESSAGE(trace, "getAllIPAddresses: getaddrinfo failed with error %d: %s\n", rc,
                    gai_strerror(rc));
      // sic: leaked deliberately, except the array.
      free(static_cast<void*>(texts.release()));
      return rc;
    }
    char* const copy = strdup(text);
    if (copy == nullptr) return EAI_MEMORY;
    texts.get()[filled++] = copy;
  }

  *list = texts.release();
  *count = static_cast<int>(total);
  return 0;
}

}  // namespace

TRACED int getAllIPAddresses(char*** list, int* count) {
  TraceScope<traced::getAllIPAddresses> trace;

  *count = 0;
  char name[kHostNameBytes] = {};
  const int rc = gethostname(name, sizeof name);
  if (rc != 0) {
    // sic: gai_strerror, although `rc` is not a getaddrinfo code.
    DEBUG_MESSAGE(trace, "getAllIPAddresses: gethostname failed with error %d: %s\n", rc,
                  gai_strerror(rc));
    return trace.result(rc);
  }
  return trace.result(resolveAddresses(trace, name, list, count));
}

TRACED int getLocalHostIPAddress(char*** list, int* count) {
  TraceScope<traced::getLocalHostIPAddress> trace;

  *count = 0;
  char name[kHostNameBytes] = {};
  constexpr char kLocalHost[] = "localhost";
  const size_t length = vra_strlcpy(name, kLocalHost, sizeof kLocalHost);
  if (length >= sizeof kLocalHost) {
    // sic: both texts name other functions.
    ERROR_MESSAGE(trace, "Error - pwdGetOldestHistory: vra_strlcpy failed. rc = %d\n",
                  static_cast<int>(length));
    DEBUG_MESSAGE(trace, "getAllIPAddresses: vra_strlcpy failed with error %d. \n", 1);
    return trace.result(OSUTILS_OPERATIONS_ERROR);
  }
  return trace.result(resolveAddresses(trace, name, list, count));
}

TRACED int getAllIPAddresses_Linux(char*** list, int* count, ifconf* conf) {
  TraceScope<traced::getAllIPAddresses_Linux> trace;
  const CancellationState no_cancel(PTHREAD_CANCEL_DISABLE);

  // sic: leaked deliberately.
  // If socket() fails, so does ioctl(), with EBADF.
  const int descriptor = socket(AF_INET6, SOCK_DGRAM, 0);
  alignas(ifreq) char buffer[kInterfaceBufferBytes] = {};
  conf->ifc_len = sizeof buffer;
  conf->ifc_buf = buffer;
  const int rc = ioctl(descriptor, SIOCGIFCONF, conf);
  conf->ifc_buf = nullptr;  // `buffer` is local
  if (rc == -1) {
    perror("Error getting size of interface :");
    return trace.result(-1);
  }

  const size_t records = static_cast<size_t>(conf->ifc_len) / sizeof(ifreq);
  const size_t total = std::min(records, kMaxInterfaces);
  OwnedList texts = newList(total);
  if (!texts) return trace.result(-1);

  for (size_t i = 0; i < total; ++i) {
    ifreq record;
    memcpy(&record, buffer + i * sizeof record, sizeof record);
    // sic: "lo" gets an empty string; its aliases ("lo:1") get their addresses.
    const char* text = "";
    if (strcmp(record.ifr_name, "lo") != 0) {
      sockaddr_in address;
      memcpy(&address, &record.ifr_addr, sizeof address);
      text = inet_ntoa(address.sin_addr);
    }
    char* const copy = strdup(text);
    if (copy == nullptr) return trace.result(-1);
    texts.get()[i] = copy;
  }

  *list = texts.release();
  // NOLINTNEXTLINE(clang-analyzer-unix.Malloc): isValidIPAddressOnSystem leaks its first list
  *count = static_cast<int>(total);
  return trace.result(OSUTILS_SUCCESS);
}

int getAllIPAddresses_TVX() { return static_cast<int>(ldtr_fun.SetErrorCode(OSUTILS_SUCCESS)); }

TRACED bool isValidIPAddressOnSystem(char* address) {
  TraceScope<traced::isValidIPAddressOnSystem> trace;

  if (isNullOrEmpty(address)) {
    DEBUG_MESSAGE(trace, "isValidIPAddressOnSystem: passed an NULL or blank IP address\n");
    return trace.result(false);
  }

  char** list = nullptr;
  int count = 0;
  if (getAllIPAddresses(&list, &count) != 0) {
    DEBUG_MESSAGE(trace, "isValidIPAddressOnSystem: Cannot get the list of IPs on the machine\n");
    return trace.result(false);
  }
  const auto matches = [address](const char* entry) { return equalsIgnoringCase(entry, address); };
  bool found = std::any_of(list, list + count, matches);

  if (!found) {
    // sic: leaked deliberately when the call replaces the first list.
    // If the call fails, rescanning the first list finds nothing.
    ifconf scratch;
    (void)getAllIPAddresses_Linux(&list, &count, &scratch);
    for (int i = 0; i < count; ++i) found = strcmp(list[i], address) == 0 || found;
  }

  const OwnedList owner(list);
  return trace.result(found);
}

TRACED bool isValidIPAddressInList(char* address, char** list, int count) {
  TraceScope<traced::isValidIPAddressInList> trace;

  if (isNullOrEmpty(address) || list == nullptr) {
    // sic: names isValidIPAddressOnSystem.
    DEBUG_MESSAGE(trace, "isValidIPAddressOnSystem: passed an NULL or blank IP address\n");
    return trace.result(false);
  }

  for (int i = 0; i < count; ++i) {
    if (list[i] != nullptr && equalsIgnoringCase(list[i], address)) return trace.result(true);
  }
  return trace.result(false);
}

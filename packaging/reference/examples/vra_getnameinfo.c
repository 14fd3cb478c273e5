#include <arpa/inet.h>
#include <ldap_clientosutils.h>
#include <netinet/in.h>
#include <stdio.h>
#include <stdlib.h>

int main(void) {
  struct sockaddr_in address = {.sin_family = AF_INET, .sin_port = htons(22)};
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  char* service = NULL;
  const int rc = vra_getnameinfo((const struct sockaddr*)&address, sizeof address, NULL, &service);
  printf("%d %s\n", rc, service != NULL ? service : "?");
  free(service);
  return 0;
}

/* Prints:
 * 0 ssh
 */

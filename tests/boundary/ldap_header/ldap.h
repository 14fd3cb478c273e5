/* What an LDAP client header defines: the common result codes as on the wire, its own errors below 0. */
#ifndef LDAP_H
#define LDAP_H

#define LDAP_SUCCESS 0x00
#define LDAP_OPERATIONS_ERROR 0x01
#define LDAP_CONSTRAINT_VIOLATION 0x13
#define LDAP_NO_SUCH_OBJECT 0x20
#define LDAP_INVALID_CREDENTIALS 0x31
#define LDAP_INSUFFICIENT_ACCESS 0x32
#define LDAP_UNAVAILABLE 0x34
#define LDAP_UNWILLING_TO_PERFORM 0x35
#define LDAP_ALREADY_EXISTS 0x44
#define LDAP_OTHER 0x50
#define LDAP_PARAM_ERROR (-9)
#define LDAP_NO_MEMORY (-10)

#endif

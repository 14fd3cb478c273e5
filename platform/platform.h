// What libosutils uses of the platform libraries. The dynamic linker resolves the references, so a site or a test can
// replace each library without a rebuild. The libraries include this header and export what it declares.
#pragma once

#include <stdarg.h>
#include <stddef.h>
#include <stdint.h>

#pragma GCC visibility push(default)
extern "C" {

// libtrc
extern uint64_t trcEvents;
int trcInit(void);
void trcWriteRec(uint64_t type, uint64_t id, const void* obj, uint64_t length, const void* data,
                 uint64_t, uint64_t, uint64_t, uint64_t);

// liborxldapdbg
void PrintDebugVa(unsigned int level, const char* format, va_list arguments);
void PrintDebug(unsigned int level, const char* format, ...) __attribute__((format(printf, 2, 3)));
int read_ldap_debug(void);

// liborxldap
char* ldap_getenv(const char* name);  // a new string, or null when the variable is unset
int ldap_putenv(char* assignment);    // the environment keeps the string itself
extern int default_autolock;
extern int configfile_read;
extern int al_configfile_counter;

// libvrastr. vra_asprintf fails only when it returns exactly -1.
int vra_asprintf(char** out, const char* format, ...) __attribute__((format(printf, 2, 3)));
int vra_snprintf(char* buffer, size_t size, const char* format, ...)
    __attribute__((format(printf, 3, 4)));
int vra_vsnprintf(char* buffer, size_t size, const char* format, va_list arguments)
    __attribute__((format(printf, 3, 0)));
size_t vra_strlcpy(char* destination, const char* source, size_t size);

// libmessage
int PrintMessageCmdLine(int, int, int, int, int, const char* text);

}  // extern "C"
#pragma GCC visibility pop

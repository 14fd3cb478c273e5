// The kinds of call that the fault drivers make fail: their calls, and two errors for each.
#pragma once

#include <errno.h>
#include <limits.h>
#include <netdb.h>

#include "faults.h"
#include "scenario.h"

// The exit status of a driver that has no scenario of the names on its command line; 1 is a finding.
constexpr int kNoScenario = 3;

struct KindOfCall {
  scenarios::Kind kind;
  const char* name;
  CallSet calls;
  int errors[2];
};

// pthread_mutex_unlock is not among them: it fails only for mutexes of other types.
// Functions that return another kind of error number are apart from those that set errno.
inline constexpr KindOfCall kKindsOfCall[] = {
    {scenarios::kMemory, "memory", Call::allocation, {ENOMEM, EAGAIN}},
    {scenarios::kMemory,
     "memory of the C library",
     {Call::vasprintf, Call::setenv, Call::newlocale},
     {ENOMEM, EINVAL}},
    {scenarios::kOpen, "open", {Call::open64, Call::fopen64}, {EMFILE, EACCES}},
    {scenarios::kRead,
     "read",
     {Call::read, Call::fread, Call::fgets, Call::getc, Call::fseeko64, Call::ftello64},
     {EIO, EINTR}},
    {scenarios::kWrite,
     "write",
     {Call::write, Call::fwrite, Call::fflush, Call::ftruncate64, Call::copy_file_range,
      Call::sendfile64},
     {ENOSPC, EIO}},
    {scenarios::kClose, "close", {Call::close, Call::fclose}, {EIO, ENOSPC}},
    {scenarios::kStatus,
     "status",
     {Call::stat64, Call::lstat64, Call::fstat64, Call::statfs, Call::access, Call::getrlimit,
      Call::isatty},
     {EIO, EACCES}},
    {scenarios::kOwner,
     "owner and mode",
     {Call::fchown, Call::fchmod, Call::chown, Call::lchown, Call::chmod},
     {EPERM, EROFS}},
    {scenarios::kDirectory,
     "directories and links",
     {Call::mkdir, Call::rmdir, Call::symlink, Call::unlink, Call::remove, Call::rename,
      Call::getcwd, Call::realpath, Call::opendir, Call::readdir},
     {EROFS, ENOSPC}},
    {scenarios::kLock, "locks", {Call::lockf64, Call::fcntl}, {ENOLCK, EDEADLK}},
    {scenarios::kLock,
     "mutexes",
     {Call::pthread_mutex_lock, Call::pthread_mutex_trylock},
     {ENOLCK, EDEADLK}},
    {scenarios::kProcess, "processes", {Call::system, Call::popen, Call::kill}, {EAGAIN, EMFILE}},
    {scenarios::kNetwork,
     "network",
     {Call::socket, Call::bind, Call::setsockopt, Call::ioctl, Call::gethostname},
     {EMFILE, ENETDOWN}},
    {scenarios::kLookup,
     "accounts",
     {Call::getpwnam, Call::getpwuid, Call::getgrnam, Call::getgrgid, Call::getpwuid_r,
      Call::getgrgid_r},
     {EIO, EMFILE}},
    {scenarios::kLookup,
     "addresses",
     {Call::getaddrinfo, Call::getnameinfo},
     {EAI_AGAIN, EAI_MEMORY}},
    {scenarios::kLookup,
     "hosts",
     {Call::gethostbyname, Call::gethostbyname_r, Call::gethostbyaddr_r},
     {TRY_AGAIN, NO_RECOVERY}},
    {scenarios::kMapping, "mapping", {Call::mmap, Call::madvise}, {ENOMEM, EAGAIN}},
    {scenarios::kSync, "fsync", {Call::fsync, Call::syncfs}, {EIO, EDQUOT}},
    {scenarios::kClock,
     "clock",
     {Call::gettimeofday, Call::localtime_r, Call::nanosleep},
     {EFAULT, EINTR}},
    {scenarios::kLibrary,
     "dynamic loader",
     {Call::dlopen, Call::dlsym, Call::dlclose},
     {ENOENT, ENOMEM}},
    {scenarios::kProcess, "system", {Call::getrandom, Call::pthread_key_create}, {EAGAIN, ENOSYS}},
    {scenarios::kWrite, "message", {Call::message}, {EIO, EPIPE}},
    {scenarios::kEnvironment,
     "environment",
     {Call::ldap_getenv, Call::ldap_putenv},
     {ENOMEM, EINVAL}},
    {scenarios::kPrint,
     "print",
     {Call::vra_asprintf, Call::vra_snprintf, Call::vra_vsnprintf, Call::vsprintf, Call::vsnprintf},
     {ENOMEM, EOVERFLOW}},
    {scenarios::kPrint, "copy", Call::vra_strlcpy, {4096, INT_MAX}},
    {scenarios::kTrace, "trace", Call::trcInit, {EACCES, ENOSPC}},
    {scenarios::kPrint, "catalogued messages", Call::PrintMessageCmdLine, {EIO, ENOENT}},
};

constexpr CallSet allKindsOfCall() {
  CallSet calls({});
  for (const KindOfCall& kind : kKindsOfCall) calls |= kind.calls;
  return calls;
}

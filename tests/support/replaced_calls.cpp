// The replaced functions for processes, the clock, prints, the network, accounts and threads.

#include <dlfcn.h>
#include <errno.h>
#include <grp.h>
#include <netdb.h>
#include <pthread.h>
#include <pwd.h>
#include <signal.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <optional>
#include <string>
#include <utility>

#include "replaced.h"

using faults::failed;
using faults::setErrorFlag;

namespace {

thread_local FakeSystem* fake_system = nullptr;
thread_local const timeval* fake_time = nullptr;
std::atomic<FakeKill*> fake_kill = nullptr;

// Codes of getaddrinfo() are negative; an error of the system is told by errno.
int resolverCode(int error) { return error < 0 ? error : failed(error, EAI_SYSTEM); }

std::atomic<bool> sleep_is_fake = false;
std::atomic<int> sleep_calls = 0;
std::function<void()>& insteadOfSleep() {
  static auto* const function = new std::function<void()>;
  return *function;
}
std::atomic<long long> slept_microseconds = 0;

}  // namespace

FakeSystem::FakeSystem(int status) : status_(status) { fake_system = this; }
FakeSystem::~FakeSystem() { fake_system = nullptr; }
int FakeSystem::run(const char* command) {
  commands_.push_back(command != nullptr ? std::optional<std::string>(command) : std::nullopt);
  return status_;
}

FakeClock::FakeClock(long seconds, long microseconds) {
  fake_time = new timeval{seconds, microseconds};
}
FakeClock::~FakeClock() { delete std::exchange(fake_time, nullptr); }

FakeKill::FakeKill(int answer) : answer_(answer) { fake_kill = this; }
FakeKill::~FakeKill() { fake_kill = nullptr; }
int FakeKill::run(Signal signal) {
  signals_.push_back(signal);
  return answer_;
}

FakeSleep::FakeSleep(std::function<void()> instead) {
  insteadOfSleep() = std::move(instead);
  sleep_calls = 0;
  slept_microseconds = 0;
  sleep_is_fake = true;
}
FakeSleep::~FakeSleep() { sleep_is_fake = false; }
int FakeSleep::calls() const { return sleep_calls; }
long long FakeSleep::microseconds() const { return slept_microseconds; }

// ---- Processes and the clock ----

REPLACE(int, system, (const char* command)) {
  if (const auto error = STRIKE(system)) return failed(*error, -1);
  if (fake_system != nullptr && FROM_LIBRARY()) {
    return fake_system->run(command);
  }
  return REAL(system)(command);
}

REPLACE(int, gettimeofday, (timeval * now, void* zone)) {
  if (const auto error = STRIKE(gettimeofday)) return failed(*error, -1);
  if (fake_time != nullptr && FROM_LIBRARY()) {
    *now = *fake_time;
    return 0;
  }
  return REAL(gettimeofday)(now, zone);
}

REPLACE(tm*, localtime_r, (const time_t* time, tm* out)) {
  if (const auto error = STRIKE(localtime_r)) return failed<tm*>(*error, nullptr);
  return REAL(localtime_r)(time, out);
}

REPLACE(tm*, gmtime_r, (const time_t* time, tm* out)) {
  if (const auto error = STRIKE(localtime_r)) return failed<tm*>(*error, nullptr);
  return REAL(gmtime_r)(time, out);
}

REPLACE(time_t, mktime, (tm * time)) {
  if (const auto error = STRIKE(localtime_r)) return failed<time_t>(*error, -1);
  return REAL(mktime)(time);
}

REPLACE(int, kill, (pid_t process, int number)) {
  if (const auto error = STRIKE(kill)) return failed(*error, -1);
  if (FakeKill* const fake = fake_kill) return fake->run({process, number});
  return REAL(kill)(process, number);
}

REPLACE(FILE*, popen, (const char* command, const char* mode)) {
  if (const auto error = STRIKE(popen)) return failed<FILE*>(*error, nullptr);
  return REAL(popen)(command, mode);
}

REPLACE(char*, fgets, (char* buffer, int size, FILE* stream)) {
  if (const auto error = STRIKE(fgets)) {
    setErrorFlag(stream);
    return failed<char*>(*error, nullptr);
  }
  return REAL(fgets)(buffer, size, stream);
}

// ---- Prints of the C library ----

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"

REPLACE(int, vsprintf, (char* buffer, const char* format, va_list arguments)) {
  if (const auto error = STRIKE(vsprintf)) return failed(*error, -1);
  return REAL(vsprintf)(buffer, format, arguments);
}

REPLACE(int, vsnprintf, (char* buffer, size_t size, const char* format, va_list arguments)) {
  if (const auto error = STRIKE(vsnprintf)) return failed(*error, -1);
  return REAL(vsnprintf)(buffer, size, format, arguments);
}

#pragma GCC diagnostic pop

// ---- The dynamic loader ----

REPLACE(int, dlclose, (void* library)) {
  const auto error = STRIKE(dlclose);
  const int result = REAL(dlclose)(library);
  return error ? failed(*error, -1) : result;
}

// ---- Network ----

REPLACE(int, socket, (int domain, int type, int protocol)) {
  if (const auto error = STRIKE(socket)) return failed(*error, -1);
  return REAL(socket)(domain, type, protocol);
}

REPLACE(int, ioctl, (int descriptor, unsigned long request, void* argument)) {
  if (const auto error = STRIKE(ioctl)) return failed(*error, -1);
  return REAL(ioctl)(descriptor, request, argument);
}

REPLACE(int, gethostname, (char* name, size_t size)) {
  if (const auto error = STRIKE(gethostname)) return failed(*error, -1);
  return REAL(gethostname)(name, size);
}

REPLACE(hostent*, gethostbyname, (const char* name)) {
  if (FROM_LIBRARY()) passed.host_name = name;
  if (const auto error = STRIKE(gethostbyname)) return failed<hostent*>(*error, nullptr);
  return REAL(gethostbyname)(name);
}

REPLACE(int, getaddrinfo,
        (const char* node, const char* service, const addrinfo* hints, addrinfo** result)) {
  if (const auto error = STRIKE(getaddrinfo)) return resolverCode(*error);
  return REAL(getaddrinfo)(node, service, hints, result);
}

REPLACE(int, getnameinfo,
        (const sockaddr* address, socklen_t length, char* host, socklen_t host_size, char* service,
         socklen_t service_size, int flags)) {
  if (FROM_LIBRARY()) passed.name_info = {host_size, service, service_size, flags};
  if (const auto error = STRIKE(getnameinfo)) return resolverCode(*error);
  return REAL(getnameinfo)(address, length, host, host_size, service, service_size, flags);
}

REPLACE(int, gethostbyname_r,
        (const char* name, hostent* entry, char* buffer, size_t size, hostent** result,
         int* error_code)) {
  if (FROM_LIBRARY()) passed.work = {entry, buffer - reinterpret_cast<char*>(entry), size};
  if (const auto error = STRIKE(gethostbyname_r)) {
    *result = nullptr;
    *error_code = *error;
    return ERANGE;
  }
  return REAL(gethostbyname_r)(name, entry, buffer, size, result, error_code);
}

REPLACE(int, gethostbyaddr_r,
        (const void* address, socklen_t length, int type, hostent* entry, char* buffer, size_t size,
         hostent** result, int* error_code)) {
  if (FROM_LIBRARY()) passed.work = {entry, buffer - reinterpret_cast<char*>(entry), size};
  if (const auto error = STRIKE(gethostbyaddr_r)) {
    *result = nullptr;
    *error_code = *error;
    return ERANGE;
  }
  return REAL(gethostbyaddr_r)(address, length, type, entry, buffer, size, result, error_code);
}

// ---- Accounts ----

REPLACE(void, setpwent, ()) {
  (void)STRIKE(setpwent);
  REAL(setpwent)();
}

REPLACE(void, endpwent, ()) {
  (void)STRIKE(endpwent);
  REAL(endpwent)();
}

REPLACE(passwd*, getpwnam, (const char* name)) {
  if (const auto error = STRIKE(getpwnam)) return failed<passwd*>(*error, nullptr);
  return REAL(getpwnam)(name);
}

REPLACE(passwd*, getpwuid, (uid_t uid)) {
  if (const auto error = STRIKE(getpwuid)) return failed<passwd*>(*error, nullptr);
  return REAL(getpwuid)(uid);
}

REPLACE(group*, getgrnam, (const char* name)) {
  if (const auto error = STRIKE(getgrnam)) return failed<group*>(*error, nullptr);
  return REAL(getgrnam)(name);
}

REPLACE(group*, getgrgid, (gid_t gid)) {
  if (const auto error = STRIKE(getgrgid)) return failed<group*>(*error, nullptr);
  return REAL(getgrgid)(gid);
}

REPLACE(int, getpwuid_r, (uid_t uid, passwd* entry, char* buffer, size_t size, passwd** result)) {
  if (const auto error = STRIKE(getpwuid_r)) {
    *result = nullptr;
    return *error;
  }
  return REAL(getpwuid_r)(uid, entry, buffer, size, result);
}

REPLACE(int, getgrgid_r, (gid_t gid, group* entry, char* buffer, size_t size, group** result)) {
  if (const auto error = STRIKE(getgrgid_r)) {
    *result = nullptr;
    return *error;
  }
  return REAL(getgrgid_r)(gid, entry, buffer, size, result);
}

// ---- Threads ----

REPLACE(int, pthread_mutex_lock, (pthread_mutex_t * mutex)) {
  if (const auto error = STRIKE(pthread_mutex_lock)) return *error;
  return REAL(pthread_mutex_lock)(mutex);
}

REPLACE(int, pthread_mutex_trylock, (pthread_mutex_t * mutex)) {
  if (const auto error = STRIKE(pthread_mutex_trylock)) return *error;
  return REAL(pthread_mutex_trylock)(mutex);
}

REPLACE(int, pthread_mutex_unlock, (pthread_mutex_t * mutex)) {
  if (const auto error = STRIKE(pthread_mutex_unlock)) {
    if (mutex->__data.__owner == gettid()) (void)REAL(pthread_mutex_unlock)(mutex);
    return *error;
  }
  return REAL(pthread_mutex_unlock)(mutex);
}

REPLACE(int, nanosleep, (const timespec* requested, timespec* left)) {
  // An interrupted sleep leaves a shorter one, which ends.
  const bool is_over = requested->tv_sec == 0 && requested->tv_nsec == 0;
  if (const auto error = STRIKE(nanosleep); error && !(is_over && *error == EINTR)) {
    if (left != nullptr) *left = {};
    return failed(*error, -1);
  }
  if (sleep_is_fake && FROM_LIBRARY()) {
    ++sleep_calls;
    slept_microseconds += requested->tv_sec * 1'000'000 + requested->tv_nsec / 1'000;
    insteadOfSleep()();
    return 0;
  }
  return REAL(nanosleep)(requested, left);
}

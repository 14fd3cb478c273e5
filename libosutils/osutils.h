/* Operating-system utilities for the tools of a directory server: administration, configuration and
 * migration. Compiles as C11 and as C++17 or later.
 *
 * Rules for this header; a function's own comment says only what differs.
 *   null     a null required argument is refused: the result is null, false or
 *            OSUTILS_PARAM_ERROR. Text that is passed is only read and stays the caller's.
 *   char*    the result is a new NUL-terminated string, released with free(); it is null if there
 *            is none and after a failure
 *   char**   the result is a new list that ends with a null entry: free() each entry, then the list
 *   int      an OSUTILS_* result code
 *   bool     true for success or yes; false gives no cause, debug tracing shows it
 *   leaks    what stays allocated or open is in the table of docs/compatibility.md
 *   threads  MT-Safe, in the terms of attributes(7): any thread may call; no state is kept between
 *            calls
 *   stack    16 KiB (PTHREAD_STACK_MIN where that is larger) is enough with the bundled platform
 *            libraries. A function that looks up accounts or hosts or runs a shell needs what the C
 *            library needs for that.
 *   cancel   a thread with asynchronous cancellation must not call. Any other thread that is
 *            cancelled during a call ends at its next cancellation point after the call. Only two
 *            kinds of call end at once: clearFile while it waits for its lock (it closes the file),
 *            and a function that runs a shell, except isNPTL, while it waits for the shell (which
 *            is killed; what it started goes on).
 *   fork     until it executes another program, the child of a program with threads must not call
 *            functions that look up accounts (createFile, copyFile and the like do) or hosts, read
 *            the local time, set the environment, load a library or run a shell: a lock that
 *            another thread held stays locked. The other functions work, tracing included.
 *   shell    a shell command runs in /bin/sh through system(): until it ends, the process ignores
 *            SIGINT and SIGQUIT and the thread blocks SIGCHLD. In a process that ignores SIGCHLD
 *            its status is lost and it counts as failed. The shell finds programs through PATH,
 *            which must be trustworthy. Arguments are not quoted in the command, so text that
 *            checkForMetaChars lets pass may still be several words (blanks, tabs), an option ("-"
 *            at the beginning) or the end of the command ("#" at the beginning of a word).
 *   failure  no exception leaves any function
 *   tracing  every function leaves an entry and an exit record unless its comment says otherwise.
 *            The exit record carries an int result, or 1 or 0 for true or false. For other results,
 *            and for isRDBMComponentInstalled, isProcessStarted, unloadSharedLib and
 *            EtcServices::getServicePort, it carries 0. */
#ifndef OSUTILS_H
#define OSUTILS_H

#include <stdbool.h>
#include <sys/types.h>

#define OSUTILS_API __attribute__((visibility("default")))

/* The version of the library that this header comes with. */
#define OSUTILS_VERSION_MAJOR 6
#define OSUTILS_VERSION_MINOR 1
#define OSUTILS_VERSION_PATCH 0
#define OSUTILS_TEXT_OF(name) #name
#define OSUTILS_DOTTED(major, minor, patch) \
  OSUTILS_TEXT_OF(major) "." OSUTILS_TEXT_OF(minor) "." OSUTILS_TEXT_OF(patch)
#define OSUTILS_VERSION \
  OSUTILS_DOTTED(OSUTILS_VERSION_MAJOR, OSUTILS_VERSION_MINOR, OSUTILS_VERSION_PATCH)

/* Result codes: the numbers of the directory's client interface. */
enum {
  OSUTILS_SUCCESS = 0,
  OSUTILS_OPERATIONS_ERROR = 1,      /* a system or platform call failed */
  OSUTILS_CONSTRAINT_VIOLATION = 19, /* the path is a directory */
  OSUTILS_NO_SUCH_OBJECT = 32,       /* no such file, service or entry */
  OSUTILS_INVALID_CREDENTIALS = 49,
  OSUTILS_INSUFFICIENT_ACCESS = 50,
  OSUTILS_UNAVAILABLE = 52,
  OSUTILS_UNWILLING_TO_PERFORM = 53,
  OSUTILS_ALREADY_EXISTS = 68,
  OSUTILS_OTHER = 80,
  OSUTILS_PARAM_ERROR = 89, /* a required pointer was null */
  OSUTILS_NO_MEMORY = 90    /* an allocation or an allocating print failed */
};

/* The customary spellings, for programs without an LDAP client header. Such a header numbers some
 * of them otherwise, so what it has defined is left alone: with one, use the names above. */
#ifndef LDAP_SUCCESS
#define LDAP_SUCCESS OSUTILS_SUCCESS
#endif
#ifndef LDAP_OPERATIONS_ERROR
#define LDAP_OPERATIONS_ERROR OSUTILS_OPERATIONS_ERROR
#endif
#ifndef LDAP_CONSTRAINT_VIOLATION
#define LDAP_CONSTRAINT_VIOLATION OSUTILS_CONSTRAINT_VIOLATION
#endif
#ifndef LDAP_NO_SUCH_OBJECT
#define LDAP_NO_SUCH_OBJECT OSUTILS_NO_SUCH_OBJECT
#endif
#ifndef LDAP_INVALID_CREDENTIALS
#define LDAP_INVALID_CREDENTIALS OSUTILS_INVALID_CREDENTIALS
#endif
#ifndef LDAP_INSUFFICIENT_ACCESS
#define LDAP_INSUFFICIENT_ACCESS OSUTILS_INSUFFICIENT_ACCESS
#endif
#ifndef LDAP_UNAVAILABLE
#define LDAP_UNAVAILABLE OSUTILS_UNAVAILABLE
#endif
#ifndef LDAP_UNWILLING_TO_PERFORM
#define LDAP_UNWILLING_TO_PERFORM OSUTILS_UNWILLING_TO_PERFORM
#endif
#ifndef LDAP_ALREADY_EXISTS
#define LDAP_ALREADY_EXISTS OSUTILS_ALREADY_EXISTS
#endif
#ifndef LDAP_OTHER
#define LDAP_OTHER OSUTILS_OTHER
#endif
#ifndef LDAP_PARAM_ERROR
#define LDAP_PARAM_ERROR OSUTILS_PARAM_ERROR
#endif
#ifndef LDAP_NO_MEMORY
#define LDAP_NO_MEMORY OSUTILS_NO_MEMORY
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* ---- Environment variables ---- */

/* Reads an environment variable of this process; null if it is unset.
 * Threads: MT-Safe env. Safe as far as the platform's access to the environment is. */
OSUTILS_API char* getEnvVar(const char* name);
/* Sets an environment variable of this process; the value may be empty.
 * Returns:
 *   - OSUTILS_OPERATIONS_ERROR: the platform refused
 *   - OSUTILS_NO_MEMORY: the assignment could not be built
 * Threads: MT-Unsafe const:env. No other thread may use the environment during the call.
 * Process: changes the environment. */
OSUTILS_API int putEnvVar(char* name, const char* value);

/* ---- Installation layout ----
 * All paths follow from one root. Nothing is cached: the environment and rdbm_lib are read at each
 * call.
 * Threads: MT-Safe env. */

/* The install root. It is the value of VRA_LDAP_HOME without one "/" or backslash at its end (an
 * empty value is an empty root), or "/opt/orx/ldap/V6.1" if the variable is unset. */
OSUTILS_API char* getVRAInstallPath(void);
/* "/var/vraldap/V6.1". No variable overrides it.
 * Threads: MT-Safe. */
OSUTILS_API char* getVRAVarBasePath(void);
/* The install root, "/etc/SchemaV" and the version as it stands. */
OSUTILS_API char* getVRABaseSchemaDirPath(const char* version);

/* The admin log files that getAdminLogsPath knows. */
enum {
  ADMIN_LOG_XQ4 = 0,      /* vraadmxq4.log */
  ADMIN_LOG_XQ4_CMDS = 1, /* vraadmxq4cmds.log */
  ADMIN_LOG_ADM = 2       /* vraadm.log */
};

/* The path of the admin log file `fileType`, below getVRAVarBasePath; null for an unknown number.
 * Threads: MT-Safe. */
OSUTILS_API char* getAdminLogsPath(int fileType);
/* Tests whether the install root followed by rdbm_lib exists. */
OSUTILS_API bool isRDBMComponentInstalled(void);
/* The install root and "/lib64". */
OSUTILS_API char* getVRAInstallLibPath(void);
/* The install root and "/sbin". */
OSUTILS_API char* getVRAInstallSbinPath(void);
/* The launcher program: the install root and "/sbin/64/vrarun". */
OSUTILS_API char* getVRAVrarunFilePath(void);

/* ---- Database discovery ----
 * These variables select the properties file that getXQ4PathAndVersion reads. The strings stay the
 * program's; the library copies none and frees none.
 *   g_isCallerVraImigr not 0    g_migBackDir/etc/xq4info
 *   g_loadLocalXQ4Path just 1   g_dirInstLocation/vraslapd-g_dirInstName/etc/ldapdb.properties
 *   otherwise                   the install root and /etc/ldapdb.properties
 *
 * A value is what follows the first "=" of the first line that has the key before it, even in a
 * comment. The line that gives the path is not searched for the version. A line of more than 1023
 * characters ends the file, and so does a read error.
 *   currentXQ4InstallPath   the path; blanks, tabs and carriage returns at its end are removed, and
 *                           then one separator
 *   currentXQ4Version       the version, not trimmed: with CR LF line ends it is invalid
 * Threads: MT-Unsafe race. The variables are read without a lock: set them before other threads
 *   call. */
OSUTILS_API extern const char* g_dirInstName;        /* the directory server instance */
OSUTILS_API extern const char* g_dirInstLocation;    /* where the instance's home directory lies */
OSUTILS_API extern const char* g_migBackDir;         /* backup made by the migration tool */
OSUTILS_API extern unsigned char g_isCallerVraImigr; /* the program is the migration tool */
OSUTILS_API extern unsigned char
    g_loadLocalXQ4Path; /* the instance's own file, not the product's */
/* The database utilities library below the install root: begins with a separator, never null.
 * Threads: MT-Unsafe race. Read without a lock: set it before other threads call. */
OSUTILS_API extern const char* rdbm_lib;

/* Reads the database product's directory and version; no version if `version` is null. Set
 * `*version` to null before the call. Waits if the file is a pipe without a writer.
 * Returns: the path; null also if the version was asked for and is missing or invalid.
 * After failure: `*version` is untouched if no version line was found, null if the version is
 *   invalid or memory ran out for it, and otherwise a string.
 * Frees: the caller frees `*version`, also after a failure.
 * Threads: MT-Safe env. No other thread may change the variables of this group.
 * Process: the platform prints a message that names the file if the version is invalid. */
OSUTILS_API char* getXQ4PathAndVersion(char** version);
/* True for one to four groups of decimal digits with single dots between them. */
OSUTILS_API bool isVersionValid(const char* version);

/* ---- File queries ----
 * Links are followed; a dangling link does not exist. A result may already be out of date. */

/* True if the path can be examined; false below a directory that may not be searched. */
OSUTILS_API bool doesFileExist(const char* path);
/* False only if permissions hide the path (EACCES): true for a missing file. */
OSUTILS_API bool canAccessFile(const char* path);
/* True for a directory, and for a block device or a socket, whose type has the same bit. */
OSUTILS_API bool isDirectory(const char* path);
/* True for a regular file, and for a socket, whose type has the same bit. */
OSUTILS_API bool isFile(char* path);
/* True if the path can be opened for appending. The test creates a missing file (mode 0666 less
 * the umask), which stays, empty. False where isDirectory returns true. */
OSUTILS_API bool canWriteToFile(char* path);
/* Tests whether the path exists, whatever its permission bits.
 * Returns:
 *   - OSUTILS_SUCCESS: it exists
 *   - OSUTILS_CONSTRAINT_VIOLATION: isDirectory returns true for it
 *   - OSUTILS_INSUFFICIENT_ACCESS: permissions hide it
 *   - OSUTILS_NO_SUCH_OBJECT: it is missing, or cannot be examined for another reason */
OSUTILS_API int checkFilePerms(const char* path);

/* ---- File operations ---- */

/* Copies the contents of `source`. A missing destination is made with createFile; an existing one
 * keeps its owner, group and mode, and is emptied before the first byte is copied: a file copied
 * onto itself ends up empty, and the call returns true. Nothing is forced to the disk.
 * Returns: true also after an error in reading, writing or closing, such as a full disk: the copy
 *   is then only the beginning of the source.
 * After failure: a destination that was made stays, empty.
 * Threads: MT-Safe locale. Looks up accounts, as vra_getpwnam_uid does.
 * Process: sets the umask as createFile does, if it makes the destination. */
OSUTILS_API bool copyFile(const char* source, char* destination, char* user, char* group,
                          unsigned int mode);
/* Makes `path` anew, empty, with owner, group and mode as in setFileOwnersAndPermissions. An
 * existing file is removed first; one that cannot be removed keeps its contents and only gets the
 * owner and the mode. For a dangling link, the target is made.
 * After failure: an existing file is gone, unless it could not be removed. A file whose owner or
 *   mode could not be set is removed (of a dangling link, the link: its target stays); one that
 *   could not be closed stays.
 * Threads: MT-Safe locale. Looks up accounts, as vra_getpwnam_uid does.
 * Process: sets the umask to 026 (octal) and leaves it so. */
OSUTILS_API bool createFile(char* path, char* user, char* group, unsigned int mode);
/* Removes a file or a link; false where isDirectory returns true, also for a link to a
 * directory. */
OSUTILS_API bool deleteFile(char* path);
/* Empties the file, or creates it with mode 0600 less the umask. Holds an exclusive advisory lock
 * on its whole length, for which it waits without limit. False where isDirectory returns true.
 * After failure: a file that it created stays. */
OSUTILS_API bool clearFile(const char* path);
/* Reads `path` into a new buffer of exactly its size, without a final NUL: the caller must know the
 * length by other means. Sizes count modulo 4 GiB. `out` must not be null: it is not checked.
 * Returns: true also after a read error: what could not be read is zero.
 * After failure: `*out` is null if the size could not be found or the buffer not be allocated, as
 *   for a pipe and a file of 2 to 4 GiB, and otherwise untouched.
 * Frees: the caller frees `*out`. */
OSUTILS_API bool readFile(const char* path, char** out);
/* What follows the last "/" of the path, or the last backslash if it has no "/"; the whole path if
 * it has neither. */
OSUTILS_API char* getFileNameFromPath(const char* path);

/* ---- Ownership and permission bits ---- */

/* Stores the names of the owner and the group, and the mode. That is the whole mode word, file type
 * included. Links are followed. `mode` must not be null: it is not checked.
 * Returns: false if one of the ids has no account; true also if memory ran out for a name, which
 *   is then null.
 * After failure: no argument is written.
 * Frees: the caller frees `*owner` and `*group`.
 * Threads: MT-Safe locale. */
OSUTILS_API bool getFileOwnersAndPermissions(const char* path, char** owner, char** group,
                                             unsigned int* mode);

/* Values of the first argument of setFileOwnersAndPermissions that are not descriptors. */
enum {
  FILE_DESC_USE_PATH = -9999,     /* owner, group and mode through the path, following links */
  FILE_DESC_USE_LINK_PATH = -8888 /* owner and group of the link itself; the mode is not touched */
};

/* Gives a file an owner, a group and exactly the permission bits `mode`. They are set through
 * `descriptor` unless that is FILE_DESC_USE_PATH or FILE_DESC_USE_LINK_PATH. `path` is required in
 * each case. A null `user` means the real user of the process, a null `group` the owner's primary
 * group; an empty one is unknown.
 * Returns: true, with FILE_DESC_USE_PATH, also if only the change of owner was refused.
 * After failure: nothing is changed if the user or the group is unknown; a change of owner is not
 *   undone if the mode could not be set.
 * Threads: MT-Safe locale. Looks up accounts, as vra_getpwnam_uid does. */
OSUTILS_API bool setFileOwnersAndPermissions(int descriptor, char* path, char* user, char* group,
                                             unsigned int mode);

/* ---- Directories, links and free space ---- */

/* "/tmp". */
OSUTILS_API char* getTempDir(void);
/* "/". */
OSUTILS_API char* getSystemDrive(void);
/* Always 0: there are no drive letters on Linux. */
OSUTILS_API int getLocalDrives(void);
/* A copy of the name: there are no short names on Linux. */
OSUTILS_API char* getShortname(const char* name);
/* The working directory of the process; null also for one of more than 8191 bytes. */
OSUTILS_API char* getCurrentWorkingDirectory(void);
/* Makes one directory, whose parent must exist, with owner, group and mode as in
 * setFileOwnersAndPermissions with FILE_DESC_USE_PATH; until these are set, it has mode 0777 less
 * the umask.
 * Returns: false also if the path exists.
 * After failure: a directory whose user or group is unknown, or whose mode could not be set, is
 *   removed, as far as possible.
 * Threads: MT-Safe locale. Looks up accounts, as vra_getpwnam_uid does. */
OSUTILS_API bool createDirectory(char* path, char* user, char* group, unsigned int mode);
/* Removes an empty directory; false for anything else, also for a link to one. */
OSUTILS_API bool deleteDirectory(const char* path);
/* Removes the directory and everything below it, with the shell command "rm -rf PATH"; also a
 * socket or a block device, whose type has the same bit. Links are removed, not followed; if `path`
 * is a link with "/" after it, the target is emptied and the link stays. Blanks and tabs split the
 * path into several, each of which is removed.
 * Returns:
 *   - true: the command succeeded, also without a path: "#d" is a comment to the shell and stays
 *   - false: the command failed; or checkForMetaChars returns true, or isDirectory false, for the
 *     path, and nothing was run
 * After failure: what the command did not remove stays.
 * Process: runs a shell command, which prints its errors to standard error. */
OSUTILS_API bool deleteDirForcefully(char* path);
/* Makes `link` point to `target`, which need not exist.
 * Returns:
 *   - 0: the link was made
 *   - -1: it cannot be made, for instance because `link` exists
 *   - OSUTILS_PARAM_ERROR: a path is null */
OSUTILS_API int createSymLink(const char* target, const char* link);
/* Removes `link`, or any other name that is not a directory.
 * Returns:
 *   - 0: it was removed
 *   - -1: it cannot be removed
 *   - OSUTILS_PARAM_ERROR: `link` is null */
OSUTILS_API int removeSymLink(const char* link);
/* True if the file system of `path` has `requiredMiB` MiB free for ordinary users; for any file
 * system if `requiredMiB` is 0 or less. Fractions of a MiB do not count. The free bytes are a
 * signed 64-bit number: from 8 EiB up to 16 EiB they count as too few for 1 MiB. */
OSUTILS_API bool isEnoughDriveSpace(long requiredMiB, char* path);
/* Cuts the string `*pathPtr` in place before its last "/": "/usr" and "usr" become empty. A null
 * `*pathPtr` is left alone.
 * Returns:
 *   - 0: also if there was nothing to cut
 *   - 1: `pathPtr` is null */
OSUTILS_API int trimLastDirectory(char** pathPtr);

/* ---- Time ---- */

/* The local time, as "2006-05-01-12:30:45.123+01:00DST", or as "2006y05y01y12y30y45" if the low
 * byte of `flag` is 0, in a buffer of 1024 bytes. The offset is the zone's standard time in hours
 * and seconds, without minutes ("+05:00" for 5 h 30 min). "DST" stands only during daylight saving.
 * A program that has changed TZ calls tzset() first.
 * Threads: MT-Safe env locale. No other thread may change the environment during the call.
 * Process: sets the C library's time zone variables, as tzset() does. */
OSUTILS_API char* getCurrentTimeStamp(int flag);
/* Milliseconds of the wall clock since the first call in this process, which returns about 0; the
 * value falls when the clock is set back. Leaves no trace.
 * Threads: MT-Safe. Two simultaneous first calls may both set the zero point. */
OSUTILS_API long current_time_in_milliseconds(void);

/* ---- Account look-ups ----
 * They hold one process-wide mutex around the account database, so that any thread may call. They
 * leave no entry or exit records, only a debug message each. The numeric ones return -99 for an
 * unknown account. If the mutex cannot be locked, vra_getpwnam_uid, vra_getgrnam_gid and
 * vra_getgrgid_gid return 0, and the others what they return for an unknown account.
 * Threads: MT-Safe locale. The mutex does not guard the program's own calls of getpwnam(),
 *   getgrnam() and the like: their static results are overwritten. */

/* The user's uid; -99 also for a null or empty name. */
OSUTILS_API int vra_getpwnam_uid(const char* name);
/* The group's gid; -99 also for a null or empty name. */
OSUTILS_API int vra_getgrnam_gid(const char* name);
/* The user's home directory. The name must not be null: it is not checked. */
OSUTILS_API char* vra_getpwnam_homedir(const char* name);
/* The group's members in database order. For a group without members the list has only the null
 * entry; for an unknown group the result is null. */
OSUTILS_API char** vra_getgrnam_mem(const char* name);
/* The uid of the user, or of the process's real user if `name` is null. */
OSUTILS_API int vra_get_uid(const char* name);
/* The primary gid of the user, or of the process's real user if `name` is null. */
OSUTILS_API int vra_get_usr_gid(const char* name);
/* The account's user name, or that of the process's real user if `name` is null. */
OSUTILS_API char* vra_get_usr_name(const char* name);
/* The gid that the database has for `gid`. */
OSUTILS_API int vra_getgrgid_gid(gid_t gid);
/* The group's name. */
OSUTILS_API char* vra_getgrgid_name(gid_t gid);

/* ---- Users and groups ----
 * If the mutex of the account look-ups cannot be locked, doesUserExist and doesGroupExist return
 * true.
 * Threads: MT-Safe locale. The static results of getpwnam(), getgrnam() and the like are
 *   overwritten, as by the account look-ups. */

/* The name of the user's primary group; a null `user` means the process's real user. */
OSUTILS_API char* getUsersPrimaryGroup(const char* user);
/* True if the group lists the user as a member or is the user's primary group. `group` must exist
 * in this spelling, and so must a user who is not listed. Members are compared with `user`, and the
 * primary group with `group`, ignoring case by the locale ("ADMIN" and "admin" differ in Turkish).
 * For a null `user`, the process's real user, only the primary group counts. */
OSUTILS_API bool isMemberOfGroup(const char* user, const char* group);
/* Tests whether the account is usable. A process whose real user has the uid of "root" tries it
 * with the shell command "/bin/su USER -c "exit 0"". For other processes, and if "root" cannot be
 * looked up, it only has to exist. If the name has a blank or a tab, or begins with "#" or "-", the
 * command tries something else ("#": a bare su, which waits for input).
 * Returns:
 *   - OSUTILS_SUCCESS: the account is usable
 *   - OSUTILS_INVALID_CREDENTIALS: the command failed
 *   - OSUTILS_PARAM_ERROR: checkForMetaChars returns true for the name, or both arguments are null
 *     (`extra` is not used otherwise)
 *   - OSUTILS_NO_SUCH_OBJECT: the user is unknown or null
 *   - OSUTILS_OTHER: the command could not be built
 * Process: runs a shell command if the real user is root. */
OSUTILS_API int isValidUser(const char* user, const void* extra);
/* True for a user of exactly this name; false for an empty name. */
OSUTILS_API bool doesUserExist(const char* user);
/* The user's home directory; "/home/USER" if the account has only "/home", in upper or lower case.
 * Process: rewinds the password database of the process (getpwent) and, on success, closes it. */
OSUTILS_API char* getUserHomeDir(const char* user);
/* True for a group of exactly this name; false for an empty name. */
OSUTILS_API bool doesGroupExist(const char* group);

/* ---- Screening ---- */

/* True if the text has one of 22 characters that a shell may interpret in a word; false for null.
 * They are & ' " | * ? ~ < > ^ ( ) [ ] { } $ \ ;, backtick, line feed and carriage return.
 * Blanks, tabs, "!" and "#" pass: see "shell" at the top. Leaves no trace. */
OSUTILS_API bool checkForMetaChars(char* s);
/* True if checkForMetaChars returns true for one of argv[1] to argv[count]: with the arguments of
 * main() all but the program's name. A null entry ends the search. Leaves no trace. */
OSUTILS_API bool checkOptionsForMetaChars(int count, char** argv);
/* True for a name that an instance, a user or a group may get. It has 1 to 8 ASCII letters, digits
 * and underscores, the first a letter; it does not begin with "orx", "sql" or "sys" and is not
 * "Users", "Admins", "guests", "public" or "local", both ignoring case by the program's locale.
 * Threads: MT-Safe locale. */
OSUTILS_API bool isValidName(char* name);

/* ---- Processes ---- */

/* Runs "LAUNCHERDIR/vrarun LAUNCHERARGS" in a shell, with its output redirected to /dev/null, and
 * waits: the launcher ends when it has started the server. Blanks and tabs separate arguments; one
 * that begins with "#" also cuts the redirection off. The directory is not screened: it must come
 * from a trusted place.
 * Returns:
 *   - 0: the launcher succeeded, or its status is lost on a distribution that is known to lose it
 *   - -1: the status is lost, as in a process that ignores SIGCHLD, or no process could be made
 *   - 32512: the launcher or the shell cannot be run (exit status 127), or no process could be made
 *   - other: the raw wait status; 256 for exit status 1
 *   - OSUTILS_PARAM_ERROR: checkForMetaChars returns true for the arguments; nothing was run
 *   - OSUTILS_NO_MEMORY: the command could not be built
 * Process: runs a shell command; remembers, after a lost status, which distribution this is. */
OSUTILS_API int startProcess(const char* launcherDir, const char* launcherArgs);
/* Sends SIGKILL to the process whose id atoi() reads in `pid`, at once and unchecked. The number 0,
 * and so any text that is not a number, means the caller's own process group, -1 every process that
 * the caller may signal, another negative number the process group of that id. A number that an int
 * cannot hold may mean any of these.
 * Returns:
 *   - 0: the signal was sent
 *   - -1: kill() failed
 *   - OSUTILS_PARAM_ERROR: checkForMetaChars returns true for the text */
OSUTILS_API int stopProcess(const char* pid);
/* Tests whether ps shows the process: a line of "ps -e -o pid -o comm" with `pid` before a blank,
 * `programName` anywhere and no "<defunct>". So "123" also matches 4123, and an empty `pid` every
 * process, the command's own included. ps cuts names to 15 characters: no longer one is found.
 * Both are patterns of grep, and words after a blank or a tab are files that it reads instead.
 * Returns:
 *   - true: there is such a line. A zombie counts where ps does not mark it (procps 4.0.2 and
 *     4.0.4, Debian 12 and 13)
 *   - false: also for an empty `programName`, always in a process that ignores SIGCHLD and, with
 *     nothing run, if checkForMetaChars returns true for an argument
 * Process: runs a shell command. The last grep's output and errors are discarded, but not after a
 *   word that begins with "#"; ps and the other greps print errors to standard error. */
OSUTILS_API bool isProcessStarted(const char* pid, const char* programName);

/* ---- Platform ---- */

/* "Linux-x64". Leaves no trace.
 * Frees: nobody; the string is static. */
OSUTILS_API const char* getOSname(void);

/* ---- Shared libraries ----
 * Threads: MT-Safe. A handle must not be used by one thread while another unloads it. */

typedef struct SharedLibHandle SharedLibHandle;

/* What mode 0 of loadSharedLib stands for: RTLD_NOW | RTLD_GLOBAL, unless the program sets it.
 * Threads: MT-Unsafe race. Read without a lock: set it before other threads load. */
OSUTILS_API extern int defFlags;
/* Loads the library as dlopen() does with `mode`; a null `fileName` means the program itself. A
 * name without "/" is searched for along the run-time path of libosutils.so, which begins with its
 * own folder, and not along the program's. "$ORIGIN" also means that folder.
 * Returns: a handle, or null.
 * After failure: dlerror() has the loader's text, unless debug tracing has fetched it or memory ran
 *   out before the loader was called.
 * Frees: only unloadSharedLib releases the result. */
OSUTILS_API SharedLibHandle* loadSharedLib(const char* fileName, int mode);
/* Unloads the library and releases the handle; an error of the loader is not reported.
 * Returns: OSUTILS_OTHER for a null handle. */
OSUTILS_API int unloadSharedLib(SharedLibHandle* lib);
/* The address of the symbol, or null. */
OSUTILS_API void* getSymAddress(SharedLibHandle* lib, const char* symbolName);

/* ---- Host addresses ----
 * As numeric text. Lists are stored through `list`, their lengths, without the null entry, through
 * `count`; `list`, `count` and `conf` must not be null: the functions that store a list do not
 * check them. The lists that the library makes have room for one more entry.
 * Threads: MT-Safe env locale. The static result of gethostbyname() is overwritten. */

struct ifconf;

/* Stores the addresses that the resolver has for this host's name. Duplicates stay.
 * Returns:
 *   - 0: also if the name has no address
 *   - -1: gethostname() failed
 *   - EAI_...: getaddrinfo() or getnameinfo() failed, or memory ran out (EAI_MEMORY); negative
 * After failure: `*count` is 0 and `*list` untouched, also if the name has no address.
 * Process: calls gethostbyname(), whose static result is overwritten. */
OSUTILS_API int getAllIPAddresses(char*** list, int* count);
/* Stores the addresses that the resolver has for "localhost". Duplicates stay.
 * Returns:
 *   - 0: also if the name has no address
 *   - 1: the platform library could not copy the name
 *   - EAI_...: getaddrinfo() or getnameinfo() failed, or memory ran out (EAI_MEMORY); negative
 * After failure: `*count` is 0 and `*list` untouched, also if the name has no address.
 * Process: calls gethostbyname(), whose static result is overwritten. */
OSUTILS_API int getLocalHostIPAddress(char*** list, int* count);
/* Stores the IPv4 addresses of this host's interfaces, at most the first 10, with an empty string
 * for each address of the interface "lo". Reads them through a new IPv6 socket. `conf` is scratch
 * space.
 * Returns:
 *   - 0: the list was stored
 *   - -1: the interfaces cannot be read or memory ran out; where the kernel has no IPv6, or no
 *     descriptor is left, the printed cause is "Bad file descriptor"
 * After failure: the outputs are untouched.
 * Threads: MT-Safe.
 * Process: prints the cause to standard error if the interfaces cannot be read. */
OSUTILS_API int getAllIPAddresses_Linux(char*** list, int* count, struct ifconf* conf);
/* The list of another platform: stores 0 in ldtr_fun (ldtr.h) and does nothing else. Leaves no
 * trace.
 * Returns: always 0.
 * Threads: MT-Safe. */
OSUTILS_API int getAllIPAddresses_TVX(void);
/* True if the address is one of this host's: one of getAllIPAddresses, ignoring case, or else
 * exactly one of getAllIPAddresses_Linux, which is called, with its effects, only if the first list
 * has no match.
 * Returns: false also if the address is empty or the host's name cannot be looked up (the
 *   interfaces are then not read), or if the interfaces cannot be read. */
OSUTILS_API bool isValidIPAddressOnSystem(char* address);
/* True if the address is one of the first `count` entries, ignoring case; null entries are passed
 * over. False for an empty address.
 * Threads: MT-Safe locale. */
OSUTILS_API bool isValidIPAddressInList(char* address, char** list, int count);

/* ---- Distinguished names ----
 * The canonical spelling that formatDn makes:
 *   letters      ASCII letters are in upper case; other letters keep their case
 *   blanks       blanks and line feeds are removed in and around types, around "=" and before
 *                separators; any white space is removed at the end of the name
 *   separators   ";" becomes ",", except after a quoted value
 *   quotes       what stands between a closing quote and the next separator is removed
 *   first        a separator or "=" as the first character of a type or a value is text: in
 *                "cn=;o=x" the value begins with ";"
 *   backslash    in a value it stays before another backslash, '"', "=" and "," and at the end of
 *                the name, and is removed before anything else; in a type it is text
 *   "\ "         the blank stays after "=" ("cn=\ a" gives "CN= A"); before a separator and at the
 *                end of the name it is removed, so that a value may become empty ("cn=\ ,o=x" gives
 *                "CN=,O=X"). At the very end, one white-space character survives after a backslash
 *                that stayed.
 *   not known    escapes of two hexadecimal digits ("cn=\41" gives "CN=41", not "CN=A"); the order
 *                inside a multi-valued component ("cn=a+sn=b" and "sn=b+cn=a" stay different);
 *                other names of a type ("cn", "commonName")
 *
 * Threads: MT-Safe locale. */

/* The name in its canonical spelling. Formatting the result again may change it where a
 * backslash was removed: "cn=a\;b" gives "CN=A;B", and that gives "CN=A,B".
 * Returns: null also for an empty name; an empty string for a name of white space alone. */
OSUTILS_API char* formatDn(char* dn);
/* True if formatDn gives the same text for both names, ignoring case. That is by the program's
 * locale; outside ASCII, only of one-byte letters. Leaves no record of its own. Not for decisions
 * on access: equal names may differ by what formatDn does not know, and different ones are equal
 * where a backslash is removed ("cn=\41" and "cn=41", an escaped "+" and a separator).
 * Returns: false also if a name is null or empty. */
OSUTILS_API bool compareDns(char* a, char* b);

#ifdef __cplusplus
} /* extern "C" */

/* ---- Thread library ---- */

/* True if the C library's threads are NPTL. The first call runs getconf(1) with popen(), through
 * PATH; the result is kept for the process, also false after a failure. Leaves no entry or exit
 * records. */
OSUTILS_API bool isNPTL();

/* ---- The services file and the inittab file ----
 * Rules for EtcServices and EtcInittab:
 *   list      readEtcServices and readInittab load it. Queries read the list, not the file; until
 *             it is loaded, every name and id is absent and every port free. Names and ids are
 *             compared exactly. A record belongs to the object: its pointer is valid until the list
 *             changes.
 *   threads   MT-Unsafe race:object. Nothing is locked: an object belongs to one thread at a time,
 *             and two processes that edit the same file may lose each other's changes.
 *   reading   in the order of the file. A read error counts as the end of the file. A line of more
 *             than 1023 characters counts as several lines of that length, also in a deletion.
 *             Reading waits if the file is a pipe without a writer.
 *   adding    appends a line, however long, and puts a record at the head of the list. Whether the
 *             file's last line is complete is not checked; write errors are not reported.
 *   deleting  rewrites the file in place from a copy at the backup path and then removes the copy.
 *             The copy is forced to the disk before the file is emptied, with its folder (with its
 *             whole file system if the folder cannot be opened or the copy is reached through a
 *             link), and the file before the copy is removed, as far as the file systems can do
 *             that. So after a power failure at any instant one of the two holds every line that
 *             was to stay, unless the copy cannot be opened.
 *   failing   a deletion that fails leaves the list as it was. If only the copy could not be
 *             opened, the file is empty and the copy is removed. A copy that could not be forced to
 *             the disk is removed. A copy shorter than the file stays, and so does the whole copy
 *             after an incomplete rewrite: put it back, or move it away, before the next deletion,
 *             which overwrites it.
 * checkFilePerms decides whether the file is a directory, is missing or is hidden. */

namespace VRAOSUtils {

/* One line of the services file. */
struct ServicesEntry {
  char name[91]; /* at most 90 characters */
  int port;
  ServicesEntry* next;
};

/* Reads, adds to and deletes from the services file. */
class OSUTILS_API EtcServices {
 public:
  /* The file to edit, which the constructor copies, and the backup path of deleteService, which is
   * read at each call. A program may point them elsewhere first. */
  static const char* ETC_SERVICES_FILE;
  static const char* ETC_SERVICES_FILE_BACKUP;
  /* The ports that are accepted: more than a TCP port can hold. */
  static const int ETC_SERVICE_MIN_PORT = 1;
  static const int ETC_SERVICE_MAX_PORT = 400000;
  /* Where callers begin their search for a free port. */
  static const int INIT_PORT_INDEX = 3700;
  static const int INIT_PORT_INDEX_INTERRUPT = 3701;

  /* Does not read the file.
   * After failure: without memory for the copy of the path the list stays empty; readEtcServices,
   *   and addService for a port that it accepts, return OSUTILS_PARAM_ERROR. */
  EtcServices();
  virtual ~EtcServices();
  EtcServices(const EtcServices&) = delete;
  EtcServices& operator=(const EtcServices&) = delete;

  /* Loads the list anew: one record for each line whose first word begins with a letter and whose
   * second word begins with a digit, whatever the protocol.
   * Returns:
   *   - OSUTILS_CONSTRAINT_VIOLATION: the file is a directory
   *   - OSUTILS_INSUFFICIENT_ACCESS: permissions hide the file
   *   - OSUTILS_NO_SUCH_OBJECT: there is no file
   *   - OSUTILS_UNWILLING_TO_PERFORM: the file cannot be opened
   *   - OSUTILS_NO_MEMORY: memory ran out
   * After failure: the list is empty. */
  int readEtcServices();
  /* Adds the line "name TAB port/tcp". The name is written as it stands.
   * Returns:
   *   - OSUTILS_ALREADY_EXISTS: the list has the name
   *   - OSUTILS_UNAVAILABLE: the list has the port, or the port is out of range
   *   - OSUTILS_CONSTRAINT_VIOLATION: the file is a directory
   *   - OSUTILS_INSUFFICIENT_ACCESS: permissions hide the file, or it cannot be opened
   *   - OSUTILS_NO_SUCH_OBJECT: there is no file
   *   - OSUTILS_NO_MEMORY: memory ran out */
  int addService(const char* name, int port);
  /* Deletes every line whose first word is `name`, but only the first record of that name: a
   * service with two lines stays in the list until it is loaded again.
   * Returns:
   *   - OSUTILS_NO_SUCH_OBJECT: the list does not have the name, or there is no file
   *   - OSUTILS_CONSTRAINT_VIOLATION: the file is a directory
   *   - OSUTILS_INSUFFICIENT_ACCESS: permissions hide the file; the copy cannot be made or forced
   *     to the disk, is shorter than the file (a full disk) or would be the file itself; one of the
   *     two cannot be opened; or the file could not be rewritten and forced to the disk to its end
   * After failure: see the rule "failing".
   * Process: sets the umask as createFile does, if it makes the copy. */
  int deleteService(const char* name);
  /* True if the list has the name. */
  bool doesServiceExist(const char* name);
  /* Finds the port of the first record of that name.
   * Returns:
   *   - -1: the list does not have the name
   *   - other: the port */
  int getServicePort(const char* name);
  /* True if the port is between 1 and 400000 and no record has it, whatever the protocol. */
  bool isPortAvaliable(int port);
  /* Finds the first such port at or above `startPort` (1 if that is lower).
   * Returns:
   *   - -1: there is none
   *   - other: the port */
  int findAvaliablePort(int startPort);
  /* The first record of that name, or null.
   * Frees: the object frees it. */
  ServicesEntry* getServicesEntry(const char* name);
  /* Empties the list. */
  void freeServicesEntries();

 private:
  char* filePath;
  ServicesEntry* servicesEntries;
};

/* One line of the inittab file. A value that fills its array has no NUL of its own: as a string it
 * continues into the next array. So an id of 10, 20, or 50 and more characters in a line is found
 * only together with what follows it; an id of any other length is found as it stands. */
struct InittabEntry {
  char id[10];
  char runlevels[10];
  char action[30];
  char process[257]; /* the command, at most 256 characters */
  InittabEntry* next;
};

/* Reads, adds to and deletes from the inittab file. */
class OSUTILS_API EtcInittab {
 public:
  /* The file to edit, which the constructor copies, and the backup path of deleteInittabEntry and
   * the beginning of the ids that findAvaliableID makes, both read at each call. A program may
   * point them elsewhere first. */
  static const char* ETC_INITTAB_FILE;
  static const char* ETC_INITTAB_FILE_BACKUP;
  static const char* ETC_INITTAB_PREFIX_ID;

  /* Does not read the file.
   * After failure: without memory for the copy of the path the list stays empty; readInittab and
   *   addInittabEntry return OSUTILS_PARAM_ERROR. */
  EtcInittab();
  virtual ~EtcInittab();
  EtcInittab(const EtcInittab&) = delete;
  EtcInittab& operator=(const EtcInittab&) = delete;

  /* Loads the list anew: one record for each line that begins, after white space, with a letter or
   * a digit. Fields are cut at their arrays' sizes; the rest of a cut field begins the next one. In
   * a line of fewer than four fields the newline belongs to the last one ("al" alone has the id
   * "al\n"), and the others are empty.
   * Returns:
   *   - OSUTILS_CONSTRAINT_VIOLATION: the file is a directory
   *   - OSUTILS_INSUFFICIENT_ACCESS: permissions hide the file
   *   - OSUTILS_NO_SUCH_OBJECT: there is no file
   *   - OSUTILS_UNWILLING_TO_PERFORM: the file cannot be opened
   *   - OSUTILS_NO_MEMORY: memory ran out
   * After failure: the list is empty. */
  int readInittab();
  /* Adds the line "id:runlevels:action:process", whole, and a record that is cut at the arrays'
   * sizes. Whether the command is there under another id is not checked.
   * Returns:
   *   - OSUTILS_ALREADY_EXISTS: the list has the id
   *   - OSUTILS_CONSTRAINT_VIOLATION: the file is a directory
   *   - OSUTILS_INSUFFICIENT_ACCESS: permissions hide the file, or it cannot be opened
   *   - OSUTILS_NO_SUCH_OBJECT: there is no file
   *   - OSUTILS_NO_MEMORY: memory ran out */
  int addInittabEntry(const char* id, const char* runlevels, const char* action,
                      const char* process);
  /* Deletes every line that begins, after white space, with a letter or digit and whose text before
   * the first ":" is `id` (all of a line without ":", its newline too), and the first record with
   * that id. Only the record is deleted if no line has the id: one with ":" in it, or one that is
   * found only together with what follows it (see InittabEntry).
   * Returns: OSUTILS_SUCCESS also if only the record was deleted; otherwise as
   *   EtcServices::deleteService.
   * After failure: see the rule "failing".
   * Process: sets the umask as createFile does, if it makes the copy. */
  int deleteInittabEntry(const char* id);
  /* True if the list has the id. */
  bool doesInittabEntryExist(const char* id);
  /* True if the list has a record whose command contains the text. */
  bool isCommandRegistered(const char* command);
  /* The first id that no record has, of ETC_INITTAB_PREFIX_ID followed by 0 to 9 and then a to z;
   * null if all are taken or memory ran out. */
  char* findAvaliableID();
  /* The first record with that id, or null.
   * Frees: the object frees it. */
  InittabEntry* getInittabEntry(const char* id);
  /* The first record whose command contains the text, or null.
   * Frees: the object frees it. */
  InittabEntry* getInittabEntryWithCommand(const char* command);
  /* A new copy of that record's id, or null. */
  char* getEntryInitIDWithCommand(const char* command);
  /* Empties the list. */
  void freeInittabEntries();

 private:
  char* filePath;
  InittabEntry* inittabEntries;
};

} /* namespace VRAOSUtils */
#endif /* __cplusplus */

#endif /* OSUTILS_H */

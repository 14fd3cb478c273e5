/* Operating-system utilities for the administration, configuration and migration tools of a
 * directory server. Compiles as C11 and as C++17 or later.
 *
 * Rules for this header; a function's own comment says only what differs.
 *   char*    a result is a new NUL-terminated string, released with free(); null when there is none
 *            or on failure. An argument is read only and stays the caller's; a null required
 *            argument is refused (the result is null, false or OSUTILS_PARAM_ERROR), not followed.
 *   char**   a result is a new list that ends in a null entry: free() each entry, then the list
 *   int      an OSUTILS_* result code
 *   bool     gives no cause: switch debug tracing on to see it
 *   threads  any thread may call; no state is kept between calls
 *   stack    16 KiB (PTHREAD_STACK_MIN where that is larger) is enough with the platform libraries
 *            that come with this one. A function that looks up accounts or hosts or runs a shell
 *            needs more: what the C library needs for that.
 *   cancel   a thread whose cancellation is asynchronous must not call. Any other that is cancelled
 *            inside a call ends at its next cancellation point after it. clearFile, while it waits
 *            for its lock, closes the file and ends at once; so does what runs a shell, but for
 *            isNPTL, while it waits for that: the shell is then killed, what it started goes on.
 *   fork     the child of a program with threads must not call, until it executes another program,
 *            what looks up accounts (which createFile, copyFile and the like do), hosts or the
 *            local time, sets the environment, loads a library or runs a shell: a lock that another
 *            thread held stays taken there. The other functions work, tracing included.
 *   failure  no exception leaves any function
 *   tracing  every function leaves an entry and an exit record unless its comment says otherwise.
 *            The exit record carries the result code, or a flag's 1 or 0; 0 for other results. */
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

/* The value of the variable, or null when it is unset. Thread-safe as far as the platform's access
 * to the environment is. */
OSUTILS_API char* getEnvVar(const char* name);
/* Sets the variable of this process, to the empty string too. The assignment becomes part of the
 * environment and is never freed, not even when the platform refuses it. Answers
 * OSUTILS_OPERATIONS_ERROR when the platform refuses, OSUTILS_NO_MEMORY. No other thread may use
 * the environment meanwhile. */
OSUTILS_API int putEnvVar(char* name, const char* value);

/* ---- Installation layout ----
 * One root, from which all paths follow. Nothing is cached: the environment and rdbm_lib are read
 * at each call. None of these stores a result code: their exit records carry 0. */

/* The install root: the value of VRA_LDAP_HOME less one "/" or backslash at its end (the empty
 * value is an empty root), or "/opt/orx/ldap/V6.1" when it is unset. */
OSUTILS_API char* getVRAInstallPath(void);
/* "/var/vraldap/V6.1", which no variable overrides. */
OSUTILS_API char* getVRAVarBasePath(void);
/* The install root, "/etc/SchemaV" and the version as it stands. Each call leaves a copy of the
 * root allocated for good. */
OSUTILS_API char* getVRABaseSchemaDirPath(const char* version);

/* The admin log files that getAdminLogsPath knows. */
enum {
  ADMIN_LOG_XQ4 = 0,      /* vraadmxq4.log */
  ADMIN_LOG_XQ4_CMDS = 1, /* vraadmxq4cmds.log */
  ADMIN_LOG_ADM = 2       /* vraadm.log */
};

/* The path of that log file below getVRAVarBasePath; null for any other `fileType`. */
OSUTILS_API char* getAdminLogsPath(int fileType);
/* True when the install root followed by rdbm_lib exists. */
OSUTILS_API bool isRDBMComponentInstalled(void);
/* The install root and "/lib64". */
OSUTILS_API char* getVRAInstallLibPath(void);
/* The install root and "/sbin". */
OSUTILS_API char* getVRAInstallSbinPath(void);
/* The launcher program: the install root and "/sbin/64/vrarun". */
OSUTILS_API char* getVRAVrarunFilePath(void);

/* ---- Database discovery ----
 * Which properties file getXQ4PathAndVersion reads is set in these variables, before any thread
 * asks: they are read without a lock. The strings stay the program's; the library copies none and
 * frees none.
 *   g_isCallerVraImigr not 0    g_migBackDir/etc/xq4info
 *   g_loadLocalXQ4Path just 1   g_dirInstLocation/vraslapd-g_dirInstName/etc/ldapdb.properties
 *   otherwise                   the install root and /etc/ldapdb.properties */
OSUTILS_API extern const char* g_dirInstName;        /* the directory server instance */
OSUTILS_API extern const char* g_dirInstLocation;    /* where its home directory lies */
OSUTILS_API extern const char* g_migBackDir;         /* backup made by the migration tool */
OSUTILS_API extern unsigned char g_isCallerVraImigr; /* the program is the migration tool */
OSUTILS_API extern unsigned char
    g_loadLocalXQ4Path; /* the instance's own file, not the product's */
/* The database utilities library below the install root: begins with a separator, never null. */
OSUTILS_API extern const char* rdbm_lib;

/* The directory of the database product: what follows the first "=" of the first line that has
 * "currentXQ4InstallPath" before it, comments included, less blanks, tabs and carriage returns at
 * its end and then one separator. Null, too, when a line with "currentXQ4Version" is wanted and not
 * found. That line's value goes untrimmed to `*version`, as a new string; the line that gave the
 * path is not looked at for it, and with a null `version` no line is. Set `*version` to null first:
 * it stays untouched when no such line is found, is null after an invalid version (then
 * PrintMessageCmdLine tells the user which file) or without memory for the copy, and may hold a
 * string that the caller must free although the answer is null. A line of more than 1023 characters
 * ends the file, as a read error does; a pipe that nobody writes to is waited for. A call that gets
 * as far as the file but answers null leaves a string allocated for good. Stores no result code. */
OSUTILS_API char* getXQ4PathAndVersion(char** version);
/* True for one to four groups of decimal digits with single dots between them. */
OSUTILS_API bool isVersionValid(const char* version);

/* ---- File queries ----
 * Links are followed, a dangling link does not exist. An answer is a snapshot. */

/* True when the path can be examined; false for a path below a directory that may not be
 * searched. */
OSUTILS_API bool doesFileExist(const char* path);
/* False only when permissions hide the path (EACCES): true for a missing file. */
OSUTILS_API bool canAccessFile(const char* path);
/* True for a directory, and for a block device or a socket, whose type has the same bit. */
OSUTILS_API bool isDirectory(const char* path);
/* True for a regular file, and for a socket, whose type has the same bit. */
OSUTILS_API bool isFile(char* path);
/* True when the path can be opened for appending. A missing file is created by the attempt (mode
 * 0666 less the umask) and stays, empty. False for what isDirectory answers true for. */
OSUTILS_API bool canWriteToFile(char* path);
/* OSUTILS_SUCCESS when the path exists, whatever its permission bits; OSUTILS_CONSTRAINT_VIOLATION
 * for what isDirectory answers true for, OSUTILS_INSUFFICIENT_ACCESS for a path that permissions
 * hide, OSUTILS_NO_SUCH_OBJECT for any other that cannot be examined, a missing one above all. */
OSUTILS_API int checkFilePerms(const char* path);

/* ---- File operations ---- */

/* Copies the contents of `source`. A missing destination is made with createFile (and stays, empty,
 * when a later step fails); an existing one keeps its owner, group and mode, and `user`, `group`
 * and `mode` are ignored. The destination is emptied before the first byte is copied: a file copied
 * onto itself ends empty, with the answer true. Neither read nor write errors are reported, a full
 * disk among them: the copy is then only the beginning of the source. Nothing is forced to the
 * disk. */
OSUTILS_API bool copyFile(const char* source, char* destination, char* user, char* group,
                          unsigned int mode);
/* Makes `path` anew, empty, with the owner, group and mode as in setFileOwnersAndPermissions. An
 * existing file is removed first, also when creation then fails; one that cannot be removed keeps
 * its contents and only gets the owner and the mode; of a dangling link the target is made. A file
 * whose owner or mode cannot be set is removed again. Sets the umask of the whole process to 026
 * (octal) and leaves it so. */
OSUTILS_API bool createFile(char* path, char* user, char* group, unsigned int mode);
/* Removes a file or a link; false for what isDirectory answers true for, a link to a directory
 * included. */
OSUTILS_API bool deleteFile(char* path);
/* Empties the file, or creates it with mode 0600 less the umask, under an exclusive advisory lock
 * on its whole length. Waits for that lock without limit. False for what isDirectory answers true
 * for. */
OSUTILS_API bool clearFile(const char* path);
/* Reads `path` into a new buffer of exactly its size, with no final NUL; the caller must know the
 * length by other means and frees `*out`. `out` itself must not be null. `*out` is untouched when
 * isDirectory answers true for the path or it cannot be opened, and null when the buffer could not
 * be allocated, as for a pipe and a file of 2 to 4 GiB; in that case the stream stays open. Sizes
 * count modulo 4 GiB. Read errors are not reported: what could not be read is zero. */
OSUTILS_API bool readFile(const char* path, char** out);
/* What follows the last "/" of the path, or the last backslash when it has no "/"; the whole path
 * when it has neither. */
OSUTILS_API char* getFileNameFromPath(const char* path);

/* ---- Ownership and permission bits ---- */

/* Stores new strings with the names of the owner and the group (free() them) and the whole mode
 * word, file type included. Links are followed. False, with no argument written, when one of the
 * ids has no account. A name that could not be copied for want of memory is null, with the answer
 * true. `mode` must not be null: it is not checked. */
OSUTILS_API bool getFileOwnersAndPermissions(const char* path, char** owner, char** group,
                                             unsigned int* mode);

/* Values of the first argument of setFileOwnersAndPermissions that are no descriptor. */
enum {
  FILE_DESC_USE_PATH = -9999,     /* owner, group and mode through the path, following links */
  FILE_DESC_USE_LINK_PATH = -8888 /* owner and group of the link itself; the mode is not touched */
};

/* Gives a file an owner, a group and exactly the permission bits `mode`, through `descriptor`
 * unless that is one of the two values above. `path` is required even with a descriptor. A null
 * `user` means the real user of the process, a null `group` the owner's primary group. False before
 * any change when the user or the group is unknown. With FILE_DESC_USE_PATH a refused change of
 * owner is tolerated and the mode is still set; an owner change is not undone when the mode cannot
 * be set. */
OSUTILS_API bool setFileOwnersAndPermissions(int descriptor, char* path, char* user, char* group,
                                             unsigned int mode);

/* ---- Directories, links and free space ---- */

/* "/tmp". */
OSUTILS_API char* getTempDir(void);
/* "/". */
OSUTILS_API char* getSystemDrive(void);
/* Always 0: there are no drive letters here. */
OSUTILS_API int getLocalDrives(void);
/* A copy of the name: there are no short names here. */
OSUTILS_API char* getShortname(const char* name);
/* The working directory of the process; null, too, for one of more than 8191 bytes. */
OSUTILS_API char* getCurrentWorkingDirectory(void);
/* Makes one directory, whose parent must exist, and gives it the owner, group and mode as
 * setFileOwnersAndPermissions does with FILE_DESC_USE_PATH; until then it has mode 0777 less the
 * umask. False when the path exists. A directory whose user or group is unknown, or whose mode
 * cannot be set, is removed again, if it can be; one whose owner cannot be changed is kept. */
OSUTILS_API bool createDirectory(char* path, char* user, char* group, unsigned int mode);
/* Removes an empty directory; false for anything else, a link to one included. */
OSUTILS_API bool deleteDirectory(const char* path);
/* Removes the directory and all below it, or a socket or block device, for which isDirectory
 * answers true as well, with the shell command "rm -rf PATH", and waits for it; the shell finds rm
 * through the program's PATH, which must be one to trust. Meanwhile the process ignores SIGINT and
 * SIGQUIT and the thread blocks SIGCHLD, as system() does. A process that ignores SIGCHLD never
 * learns how the command ended: false then. Links are removed, not followed, but a link that is
 * given with a "/" behind it has its target emptied and stays, with the answer true. False, with
 * nothing run, when checkForMetaChars answers true for the path or isDirectory false. The path
 * stands unquoted in the command: blanks and tabs split it into several paths, each of which is
 * removed; one that begins with "-" is an option. A word that begins with "#" ends the command
 * there, and a command without a path succeeds: "#d" is answered true and stays. What the command
 * did not remove stays. */
OSUTILS_API bool deleteDirForcefully(char* path);
/* Makes `link` point to `target`, which need not exist. -1 when it cannot be made, for instance
 * because `link` exists. */
OSUTILS_API int createSymLink(const char* target, const char* link);
/* Removes `link`, or any other name that is no directory. -1 when it cannot be removed. */
OSUTILS_API int removeSymLink(const char* link);
/* True when the file system of `path` has `requiredMiB` MiB or more free for ordinary users, and
 * for any file system when `requiredMiB` is 0 or less; fractions of a MiB do not count. The free
 * bytes are a signed number of 64 bits: 8 EiB and more, below 16 EiB, are too few for 1 MiB. */
OSUTILS_API bool isEnoughDriveSpace(long requiredMiB, char* path);
/* Cuts the string `*pathPtr` in place at its last "/" other than a first character; without one it
 * becomes empty. 1 for a null `pathPtr`; a null string is left alone, with the answer 0. */
OSUTILS_API int trimLastDirectory(char** pathPtr);

/* ---- Time ---- */

/* The local time as "2006-05-01-12:30:45.123+01:00DST", or as "2006y05y01y12y30y45" when the low
 * byte of `flag` is 0. The offset is that of the zone's standard time, and its last two digits are
 * its seconds, not its minutes: "+05:00" for a zone of 5 h 30 min. "DST" stands only while daylight
 * saving is in force. The string lies in a buffer of 1024 bytes. A program that changes TZ while it
 * runs calls tzset() before. Reads TZ and sets the C library's time zone variables: no other thread
 * may change the environment meanwhile. */
OSUTILS_API char* getCurrentTimeStamp(int flag);
/* Milliseconds of the wall clock since the first call in this process, which answers about 0; it
 * goes back when the clock is set back. Two first calls at the same time may both set the zero
 * point. Leaves no trace. */
OSUTILS_API long current_time_in_milliseconds(void);

/* ---- Account look-ups ---- They hold one process-wide mutex around the account database, so that
 * any threads may call them. They leave no entry or exit records, only a debug message each. The
 * numeric ones answer -99 for an unknown account. If the mutex cannot be locked, vra_getpwnam_uid,
 * vra_getgrnam_gid and vra_getgrgid_gid answer 0 and the others as for an unknown account. */

/* The user's uid; -99 for a null or empty name too. */
OSUTILS_API int vra_getpwnam_uid(const char* name);
/* The group's gid; -99 for a null or empty name too. */
OSUTILS_API int vra_getgrnam_gid(const char* name);
/* The user's home directory. The name goes to the database unscreened: it must not be null. */
OSUTILS_API char* vra_getpwnam_homedir(const char* name);
/* The group's members in database order: for a group without members a list of the null entry
 * alone, for an unknown group null. */
OSUTILS_API char** vra_getgrnam_mem(const char* name);
/* The uid of the user, or of the calling process's real user when `name` is null. */
OSUTILS_API int vra_get_uid(const char* name);
/* The primary gid of the user, or of the calling process's real user when `name` is null. */
OSUTILS_API int vra_get_usr_gid(const char* name);
/* The account's user name, or that of the calling process's real user when `name` is null. */
OSUTILS_API char* vra_get_usr_name(const char* name);
/* The gid that the database has for this gid. */
OSUTILS_API int vra_getgrgid_gid(gid_t gid);
/* The group's name. */
OSUTILS_API char* vra_getgrgid_name(gid_t gid);

/* ---- Users and groups ---- If the mutex of the account look-ups cannot be locked, doesUserExist
 * and doesGroupExist answer true. */

/* The name of the user's primary group; a null `user` means the calling process's real user. */
OSUTILS_API char* getUsersPrimaryGroup(const char* user);
/* True when the group lists the user as a member or is the user's primary group. `group` must exist
 * in this spelling, and so must a user who is not listed; a member's name is compared with `user`,
 * and the primary group's with `group`, without regard to case by the rules of the program's locale
 * ("ADMIN" and "admin" differ in a Turkish one). For a null `user`, the calling process's real
 * user, only the primary group counts. */
OSUTILS_API bool isMemberOfGroup(const char* user, const char* group);
/* OSUTILS_SUCCESS for a usable account. A process whose real user has the uid of the account "root"
 * tries the user out with the shell command "/bin/su USER -c "exit 0"", and waits for it, with
 * signals as in deleteDirForcefully: OSUTILS_INVALID_CREDENTIALS when that fails. For any other,
 * and for all when "root" cannot be looked up, it is enough that the account exists.
 * OSUTILS_PARAM_ERROR, with nothing run, when checkForMetaChars answers true for the name or both
 * arguments are null; OSUTILS_NO_SUCH_OBJECT for an unknown or a null user; OSUTILS_OTHER when the
 * command cannot be built. The name stands unquoted in the command: an account whose name holds a
 * blank or a tab, or begins with "#" or "-", is not what is tried (behind "#" the shell sees no
 * more, and a bare su waits for input). `extra` is not used otherwise. */
OSUTILS_API int isValidUser(const char* user, const void* extra);
/* True for a user of exactly this name; false for an empty one. */
OSUTILS_API bool doesUserExist(const char* user);
/* The user's home directory; "/home/USER" when the account has the bare "/home", in whatever case.
 * Rewinds the calling process's password database (getpwent) and, on success, closes it. */
OSUTILS_API char* getUserHomeDir(const char* user);
/* True for a group of exactly this name; false for an empty one. */
OSUTILS_API bool doesGroupExist(const char* group);

/* ---- Screening ---- */

/* True when the text holds one of the 22 characters & ; ` ' " | * ? ~ < > ^ ( ) [ ] { } $ \, line
 * feed and carriage return, which a shell may interpret inside a word; false for null. Blanks, tabs
 * and "!" pass: unquoted text that passes may still be several words, and a word of it that begins
 * with "#" makes the shell ignore the rest. Leaves no trace. */
OSUTILS_API bool checkForMetaChars(char* s);
/* True when one of argv[1] to argv[count] holds such a character: with the arguments of main() all
 * but the program's name. A null entry ends the search. Leaves no trace. */
OSUTILS_API bool checkOptionsForMetaChars(int count, char** argv);
/* True for a name that an instance, a user or a group may get: 1 to 8 ASCII letters, digits and
 * underscores, of which the first is a letter, not beginning with "orx", "sql" or "sys" and none of
 * "Users", "Admins", "guests", "public" and "local", without regard to case by the rules of the
 * program's locale. */
OSUTILS_API bool isValidName(char* name);

/* ---- Processes ---- The commands run through system(), which waits for the shell and has signals
 * as in deleteDirForcefully meanwhile. The shell finds ps and grep through the program's PATH,
 * which must be one to trust. */

/* Runs "LAUNCHERDIR/vrarun LAUNCHERARGS" in a shell, with its output thrown away, and waits for it:
 * the launcher returns when it has started the server. The answer is the raw wait status: 256 for
 * exit status 1, 32512 (status 127) when the launcher or the shell cannot be run. It is -1 when the
 * status is lost, as in a process that ignores SIGCHLD, and 0 instead on distributions that are
 * known to lose it; which one this is is asked once in a process. When no process can be made, it
 * is 32512 or -1, as the C library's system() has it. Blanks and tabs separate several arguments,
 * and one that begins with "#" ends the command there, so that the output is not thrown away.
 * OSUTILS_PARAM_ERROR, with nothing run, when checkForMetaChars answers true for the arguments; the
 * directory is not screened: it must come from a trusted place. OSUTILS_NO_MEMORY. */
OSUTILS_API int startProcess(const char* launcherDir, const char* launcherArgs);
/* Sends SIGKILL to the process whose id atoi() reads in `pid`, at once and unchecked: 0, and so any
 * text that is no number, is the caller's own process group, -1 every process that the caller may
 * signal, another negative number the process group of that id, and a number that an int cannot
 * hold may be anything. The answer is that of kill(), 0 or -1; OSUTILS_PARAM_ERROR when
 * checkForMetaChars answers true for the text. */
OSUTILS_API int stopProcess(const char* pid);
/* True when a line of "ps -e -o pid -o comm" has `pid` in front of a blank, `programName` anywhere
 * and no zombie marker: 4123 counts for "123", and an empty `pid` for every process, the command's
 * own among them. The command name stands there as the kernel keeps it, at most 15 characters: a
 * longer `programName` is never found. Both are patterns of grep: one that begins with "-" is an
 * option of it, words behind a blank or a tab are files that it reads instead, and a word that
 * begins with "#" cuts the command short, with its redirection. What ps and the first two greps
 * write to standard error is not thrown away. False for an empty `programName`, and always in a
 * process that ignores SIGCHLD. True for a zombie where ps prints no "<defunct>" in its command
 * column: procps 4.0.2 and 4.0.4 (Debian 12 and 13) print none. False, with nothing run, when
 * checkForMetaChars answers true for an argument. Stores no result code. */
OSUTILS_API bool isProcessStarted(const char* pid, const char* programName);

/* ---- Platform ---- */

/* "Linux-x64", in static storage: never free it. Leaves no trace. */
OSUTILS_API const char* getOSname(void);

/* ---- Shared libraries ---- A handle must not be used by one thread while another unloads it.
 * These store no result code. */

typedef struct SharedLibHandle SharedLibHandle;

/* What mode 0 of loadSharedLib stands for: RTLD_NOW | RTLD_GLOBAL, unless the program sets it. Read
 * without a lock: set it before other threads load. */
OSUTILS_API extern int defFlags;
/* Loads the library as dlopen() does with `mode`; a null `fileName` means the program itself. A
 * name without "/" is looked for along the run-time path of libosutils.so, which begins with its
 * own folder, and not along the program's; "$ORIGIN" is that folder too. The result is released
 * with unloadSharedLib only; null on failure, with the loader's error text left for dlerror()
 * unless debug tracing has fetched it or memory ran out before the loader was asked. */
OSUTILS_API SharedLibHandle* loadSharedLib(const char* fileName, int mode);
/* Unloads the library and releases the handle; whether the loader agreed is not looked at.
 * OSUTILS_OTHER for a null handle. */
OSUTILS_API int unloadSharedLib(SharedLibHandle* lib);
/* The address of the symbol, or null. */
OSUTILS_API void* getSymAddress(SharedLibHandle* lib, const char* symbolName);

/* ---- Host addresses ---- As numeric text. Lists are stored through `list`, their lengths, without
 * the null entry, through `count`; neither may be null, nor `conf`. The lists that the library
 * makes have room for one entry more. */

struct ifconf;

/* The addresses that the resolver has for this host's name, duplicates included. 0, or the negative
 * EAI_ code of getaddrinfo() or getnameinfo(), EAI_MEMORY, or -1 when gethostname() fails; `*count`
 * is then 0 and `*list` untouched. A name without an address gives that too, with the answer 0.
 * When an address cannot be made text, the texts before it stay allocated for good. Calls
 * gethostbyname(), whose static result is overwritten. */
OSUTILS_API int getAllIPAddresses(char*** list, int* count);
/* The addresses of "localhost", likewise; 1 when that name could not be copied. */
OSUTILS_API int getLocalHostIPAddress(char*** list, int* count);
/* The IPv4 addresses of this host's interfaces, an empty string for each of the interface "lo": at
 * most the first 10. `conf` is scratch space, worthless afterwards. -1 when the interfaces cannot
 * be read, with the cause on standard error, or memory runs out; the outputs are then untouched.
 * They are read through a new IPv6 socket, which stays open for good: where the kernel has no IPv6,
 * or no descriptor is left, the answer is -1 and the cause reads "Bad file descriptor". */
OSUTILS_API int getAllIPAddresses_Linux(char*** list, int* count, struct ifconf* conf);
/* Answers 0, which it stores in ldtr_fun (ldtr.h), and does nothing else: the list of another
 * platform. Leaves no trace. */
OSUTILS_API int getAllIPAddresses_TVX(void);
/* True when the address is one of getAllIPAddresses, without regard to case, or else one of
 * getAllIPAddresses_Linux, exactly, which is asked, with its effects, only when the former have no
 * match. The first list then stays allocated for good, unless the interfaces cannot be read: false
 * then. False, with the interfaces not asked, for an empty address and when the host's name cannot
 * be looked up. */
OSUTILS_API bool isValidIPAddressOnSystem(char* address);
/* True when the address is one of the first `count` entries, without regard to case. False for an
 * empty address. Null entries are passed over. */
OSUTILS_API bool isValidIPAddressInList(char* address, char** list, int count);

/* ---- Distinguished names ---- */

/* The name in one canonical spelling: ASCII letters in upper case, without blanks and line feeds in
 * and around types, around "=" and before separators, with "," for ";" (but not behind a quoted
 * value), without what follows a closing quote, and without white space at its end. The first
 * character of a type or a value is text whatever it is: of "cn=;o=x" the ";" becomes the value's
 * first character.
 *
 * In a value, a backslash stays before another one, '"', "=" and "," and at the end of the name,
 * and is dropped before anything else. Blanks that were escaped are kept behind "=" ("cn=\ a" gives
 * "CN= A"), and removed like others before a separator and at the end of the name, which may leave
 * a value empty ("cn=\ ,o=x" gives "CN=,O=X"). One white-space character at the very end survives
 * behind a backslash that stayed. In a type a backslash is text like any other. A name of white
 * space alone gives an empty string; null, too, for an empty name.
 *
 * What it does not know: escapes of two hexadecimal digits ("cn=\41" gives "CN=41", not "CN=A"),
 * the order inside a multi-valued component ("cn=a+sn=b" and "sn=b+cn=a" stay different), other
 * names of a type ("cn", "commonName"), and letters outside ASCII, which keep their case.
 *
 * Do not format a spelling again: where a backslash was dropped it may change ("cn=a\;b" gives
 * "CN=A;B", and that "CN=A,B"). */
OSUTILS_API char* formatDn(char* dn);
/* True when formatDn gives the same text for both names, without regard to case by the rules of the
 * program's locale: letters outside ASCII are equal in either case only where they are single
 * bytes. False when a name is null or empty. Not for decisions on access: equal names may differ by
 * what formatDn does not know, and different ones are equal where a backslash was dropped: "cn=\41"
 * and "cn=41", or a name with an escaped "+" and one with a separator there. Leaves no record of
 * its own. */
OSUTILS_API bool compareDns(char* a, char* b);

#ifdef __cplusplus
} /* extern "C" */

/* True when the C library's threads are NPTL, as getconf(1), found through the program's PATH, says
 * at the first call; the answer is kept, also that of a failure, false. Leaves a pipe open for
 * good, in programs that are run later too, and the ended getconf to be waited for: one of each for
 * every thread among the first callers. Leaves no entry or exit records. */
OSUTILS_API bool isNPTL();

namespace VRAOSUtils {

/* One line of the services file. */
struct ServicesEntry {
  char name[91]; /* at most 90 characters */
  int port;
  ServicesEntry* next;
};

/* Reads, adds to and deletes from the services file.  Call readEtcServices first: all questions are
 * answered from the list that it loads, not from the file, and without it every name is absent and
 * every port free. Names are compared exactly. Nothing is locked: an object belongs to one thread
 * at a time, and two processes that edit the same file may lose each other's changes. */
class OSUTILS_API EtcServices {
 public:
  /* The file to edit, copied by the constructor, and the copy that deleteService makes of it while
   * it works, read at each call. A program may point them elsewhere first. */
  static const char* ETC_SERVICES_FILE;
  static const char* ETC_SERVICES_FILE_BACKUP;
  /* The ports that are accepted: more than a TCP port can hold. */
  static const int ETC_SERVICE_MIN_PORT = 1;
  static const int ETC_SERVICE_MAX_PORT = 400000;
  /* Where callers begin their search for a free port. */
  static const int INIT_PORT_INDEX = 3700;
  static const int INIT_PORT_INDEX_INTERRUPT = 3701;

  /* Does not read the file. Without memory for the copy of its path the list stays empty:
   * readEtcServices answers OSUTILS_PARAM_ERROR, as does addService for a port that it accepts. */
  EtcServices();
  virtual ~EtcServices();
  EtcServices(const EtcServices&) = delete;
  EtcServices& operator=(const EtcServices&) = delete;

  /* Loads the list anew, one record for each line whose first word begins with a letter and whose
   * second word begins with a digit, in the order of the file, whatever the protocol; it is empty
   * after any failure; a read error is none, but the end of the file. A line of more than 1023
   * characters counts as several lines of that length, here and in deleteService. Waits when the
   * file is a pipe that nobody writes to. Answers what checkFilePerms says of the file,
   * OSUTILS_UNWILLING_TO_PERFORM when it cannot be opened, OSUTILS_NO_MEMORY. */
  int readEtcServices();
  /* Appends "name TAB port/tcp" to the file and puts a record at the head of the list. Whether the
   * file's last line is complete is not looked at. The name is written as it stands, however long.
   * OSUTILS_ALREADY_EXISTS or OSUTILS_UNAVAILABLE when the list has the name or the port, the
   * latter also for a port out of range; what checkFilePerms says of the file;
   * OSUTILS_INSUFFICIENT_ACCESS when it cannot be opened; OSUTILS_NO_MEMORY. Write errors are not
   * reported. */
  int addService(const char* name, int port);
  /* Removes every line whose first word is `name` from the file, which is rewritten in place from a
   * copy at ETC_SERVICES_FILE_BACKUP, and the first record of that name from the list: one of a
   * service with two lines stays in the list until it is loaded again. Sets the umask as createFile
   * does when it makes the copy.
   *
   * OSUTILS_NO_SUCH_OBJECT when the list has no such name; what checkFilePerms says of the file;
   * OSUTILS_INSUFFICIENT_ACCESS when the copy cannot be made, is shorter than the file (a full
   * disk), would be the file itself or cannot be forced to the disk (it is removed then), when one
   * of the two cannot be opened, and when the file could not be rewritten, or forced to the disk,
   * to its end. The list is then unchanged. When only the copy cannot be opened, the file is left
   * empty and the copy is removed. A short copy stays; so does the whole one after an incomplete
   * rewrite: put it back, or move it away, before the next call, which overwrites it.
   *
   * The copy is forced to the disk before the file is emptied, with its folder (with its whole file
   * system when the folder cannot be opened or the copy is reached through a link), and the file
   * before the copy is removed, as far as the file systems can do that. So after a power failure at
   * any instant one of the two holds every line that was to stay, unless the copy cannot be
   * opened. */
  int deleteService(const char* name);
  bool doesServiceExist(const char* name);
  /* The port of the first record of that name, or -1. */
  int getServicePort(const char* name);
  /* True when the port lies in 1 to 400000 and no record has it, of whichever protocol. */
  bool isPortAvaliable(int port);
  /* The first such port at or above `startPort` (1 when that is lower), or -1. The exit record
   * carries the answer. */
  int findAvaliablePort(int startPort);
  /* The first record of that name, or null. It belongs to the object: valid until the list
   * changes. */
  ServicesEntry* getServicesEntry(const char* name);
  /* Empties the list. */
  void freeServicesEntries();

 private:
  char* filePath;
  ServicesEntry* servicesEntries;
};

/* One line of the inittab file. A value that fills its array has no NUL of its own: as a string it
 * reads on into the next one. So an id of 10, 20, or 50 and more characters in a line is found only
 * together with what follows it, one of any other length as it stands. */
struct InittabEntry {
  char id[10];
  char runlevels[10];
  char action[30];
  char process[257]; /* the command, at most 256 characters */
  InittabEntry* next;
};

/* Reads, adds to and deletes from the inittab file. Call readInittab first: all questions are
 * answered from the list that it loads, not from the file, and without it every id is absent. Ids
 * are compared exactly, commands are found by any part of them. Nothing is locked: an object
 * belongs to one thread at a time, and two processes that edit the same file may lose each other's
 * changes. */
class OSUTILS_API EtcInittab {
 public:
  /* The file to edit, copied by the constructor, the copy that deleteInittabEntry makes of it while
   * it works, and the beginning of the ids that findAvaliableID makes, both read at each call. A
   * program may point them elsewhere first. */
  static const char* ETC_INITTAB_FILE;
  static const char* ETC_INITTAB_FILE_BACKUP;
  static const char* ETC_INITTAB_PREFIX_ID;

  /* Does not read the file. Without memory for the copy of its path the list stays empty:
   * readInittab and addInittabEntry answer OSUTILS_PARAM_ERROR. */
  EtcInittab();
  virtual ~EtcInittab();
  EtcInittab(const EtcInittab&) = delete;
  EtcInittab& operator=(const EtcInittab&) = delete;

  /* Loads the list anew, one record for each line that begins, behind white space, with a letter or
   * a digit, in the order of the file; fields are cut at their arrays' sizes, the rest of a cut one
   * begins the next field. In a line of fewer than four fields the newline belongs to the last one
   * ("al" alone has the id "al\n"), and the others are empty. The list is empty after any failure;
   * a read error is none, but the end of the file. A line of more than 1023 characters counts as
   * several lines of that length, here and in deleteInittabEntry. Waits when the file is a pipe
   * that nobody writes to. Answers what checkFilePerms says of the file,
   * OSUTILS_UNWILLING_TO_PERFORM when it cannot be opened, OSUTILS_NO_MEMORY. */
  int readInittab();
  /* Appends "id:runlevels:action:process" to the file, whole, and puts a record, cut at the arrays'
   * sizes, at the head of the list. Whether the file's last line is complete is not looked at, nor
   * whether the command is there under another id. OSUTILS_ALREADY_EXISTS when the list has the id;
   * what checkFilePerms says of the file; OSUTILS_INSUFFICIENT_ACCESS when it cannot be opened;
   * OSUTILS_NO_MEMORY. Write errors are not reported. */
  int addInittabEntry(const char* id, const char* runlevels, const char* action,
                      const char* process);
  /* Removes every line that begins, behind white space, with a letter or digit and whose text
   * before the first ":" is `id` from the file, and the first record with that id from the list;
   * all of a line without ":" counts, its newline too. OSUTILS_SUCCESS does not mean that a line
   * went: of an id that the list has but no line begins with only the record goes, so of one with
   * ":" in it and of one that is found only together with what follows it. The file is rewritten as
   * EtcServices::deleteService does, with the same answers, the same effect on the umask and the
   * same state after a failure. */
  int deleteInittabEntry(const char* id);
  bool doesInittabEntryExist(const char* id);
  bool isCommandRegistered(const char* command);
  /* The first id that no record has of ETC_INITTAB_PREFIX_ID followed by 0 to 9 and then a to z, as
   * a new string; null when all are taken or none can be made. */
  char* findAvaliableID();
  /* The first record with that id, or null. It belongs to the object: valid until the list
   * changes. */
  InittabEntry* getInittabEntry(const char* id);
  /* The first record whose command contains the text; it belongs to the object likewise. */
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

/* Section files, string hashes and lists, formatted strings, the error state, semaphores and
 * processes.
 *
 * C linkage throughout. Strings are NUL-terminated bytes, never NULL unless an operation says so;
 * paths are used as they stand (see root_path.h for where the system's own files lie). An operation
 * that fails sets the calling thread's error code, which KAPICErrGet() gives. All operations may be
 * called from any thread; one hash, list or stream belongs to one thread at a time.
 */
#pragma once

#include <stdio.h>

#ifdef __cplusplus
extern "C" {
#endif
#pragma GCC visibility push(default)

/* ---- Error state ---- */

/* The error codes. What failed is in the code; where, in the position that is kept beside it. */
enum TARQErrorCode {
    TARQ_ERR_NONE = 0,
    TARQ_ERR_NO_MEMORY = 0x0200,      /* an allocation failed */
    TARQ_ERR_OPEN_FILE = 0x0900,      /* a file cannot be opened; see errno */
    TARQ_ERR_READ_FILE = 0x0A00,      /* a file cannot be read; see errno */
    TARQ_ERR_WRITE_FILE = 0x0B00,     /* a file cannot be written or renamed; see errno */
    TARQ_ERR_BAD_PARAMETER = 0x0D00,  /* an argument is missing or could break a file's format */
    TARQ_ERR_SEMAPHORE = 0x0E00,      /* a lock cannot be taken; see errno and the system log */
    TARQ_ERR_NO_SHARE = 0x1400,       /* the catalogue has no share of that name */
    TARQ_ERR_SHARE_VOLUME = 0x1A00,   /* the volume is not mounted where it was recorded */
    TARQ_ERR_SHARE_EXISTS = 0x1B00,   /* the catalogue has a share of that name already */
    TARQ_ERR_SHARE_OVERLAP = 0x1C00,  /* the folder contains, or is inside, another share's */
    TARQ_ERR_SHARE_FOLDER = 0x1D00,   /* there is no such folder; see errno */
    TARQ_ERR_SHARE_IDENTITY = 0x1E00, /* another folder is where the share's was recorded */
    TARQ_ERR_NO_KEY = 0x2000,         /* the section has no such key */
    TARQ_ERR_NO_SECTION = 0x2200,     /* the file has no such section */
    TARQ_ERR_NO_VOLUME = 0x2300,      /* the path lies on no volume, or cannot be examined */
    TARQ_ERR_LOOKUP = 0x3100,         /* the name service failed */
    TARQ_ERR_SERVICE = 0xEA00,        /* the service manager refused or cannot be reached */
    TARQ_ERR_SERVICE_BUSY = 0xEB00    /* the unit is being started already */
};

/* The calling thread's last error code; 0 when no operation has failed on it. A success leaves it
 * as it was. */
int KAPICErrGet(void);
/* Sets the calling thread's error code, with the source position that it arose at. `file` must
 * outlive the thread (a literal). */
void KAPICErrSetEx(int code, const char* file, int line);
/* What `code` means, for a person: a literal in English, "unknown error" for a code that is not in
 * the list. */
const char* KAPICErrText(int code);

/* ---- String hashes: string keys to string values; keys are unique and compared byte by byte ----
 */

typedef struct KAPICSzHashRec* KAPICSzHash;

/* An empty hash; NULL when there is no memory. `capacity` is a hint, never a limit. Free with
 * KAPICSzHashFree. */
KAPICSzHash KAPICSzHashAlloc(int capacity);
/* Frees the hash and its strings. NULL is allowed. */
void KAPICSzHashFree(KAPICSzHash hash);
/* The value of `key`, or NULL when it is absent or an argument is NULL. The hash's own: valid until
 * the key is set again or the hash is emptied or freed. */
const char* KAPICSzHashGetValue(KAPICSzHash hash, const char* key);
/* Sets `key` to a copy of `value`. 0, or -1 when an argument is NULL or there is no memory. */
int KAPICSzHashSetValue(KAPICSzHash hash, const char* key, const char* value);
/* Empties the hash. */
void KAPICHashRemoveAll(KAPICSzHash hash);
/* Walks the hash in byte-wise order of the keys: start with *position 0; gives 1 and the next key
 * and value (the hash's own), or 0 at the end. The hash must not change during the walk. */
int KAPICSzHashNext(KAPICSzHash hash, int* position, const char** key, const char** value);

/* ---- String lists: ordered strings ---- */

typedef struct KAPICSzListRec* KAPICSzList;

/* An empty list; NULL when there is no memory. `capacity` is a hint, never a limit. Free with
 * KAPICSzListFree. */
KAPICSzList KAPICSzListAlloc(int capacity);
/* Frees the list and its strings. NULL is allowed. */
void KAPICSzListFree(KAPICSzList list);
/* Appends a copy of `item`. 0, or -1 when an argument is NULL or there is no memory. */
int KAPICSzListPush(KAPICSzList list, const char* item);
/* Empties the list. */
void KAPICSzListRemoveAll(KAPICSzList list);
/* The number of entries; 0 for NULL. */
int KAPICSzListCount(KAPICSzList list);
/* Entry `index`, counted from 0; NULL past either end. The list's own: valid until the list is
 * emptied or freed. */
const char* KAPICSzListGet(KAPICSzList list, int index);

/* ---- Formatted strings ---- */

/* `format` with its "%s" replaced by `argument`, newly allocated; NULL when an argument is NULL,
 * the format holds any conversion but "%s" and "%%", or there is no memory. Free with KAPICStrPut.
 */
char* KAPICStrGet(const char* format, const char* argument);
/* Frees a string of KAPICStrGet. NULL is allowed. */
void KAPICStrPut(char* text);

/* ---- Section files ----
 *
 * [name] lines, each followed by the section's key="value" lines; blank lines and lines that begin
 * with "#" are comments. A write goes to a temporary file in the same folder, is flushed to disk
 * and renamed over the old file, whose mode and owner it takes: after a crash or a full disk at any
 * instant the old file or the new one is there. Writers do not lock: callers serialise them (see
 * the semaphores below).
 *
 * Of several sections of one name, and of several lines of one key, the first counts. A file of
 * more than 8 MiB is refused (TARQ_ERR_READ_FILE, errno EFBIG).
 *
 * Refused with TARQ_ERR_BAD_PARAMETER, nothing written: a line break in a name, key or value, "]"
 * in a section name, "=" or a quote in a key, an empty key.
 */

/* 1 when something exists at `path`, else 0. */
int KAPICFileExist(const char* path);
/* Adds the section's keys and values to `into`. Positive: read; 0: there is no such section;
 * negative: failure. */
int KAPICFileGetSection(const char* path, const char* section, KAPICSzHash into);
/* Copies one value, cut to size - 1 bytes, and its terminator into `buffer`. 0, or negative:
 * TARQ_ERR_NO_SECTION and TARQ_ERR_NO_KEY tell absence (the buffer is left alone) from failure. A
 * file that does not exist has no section. */
int KAPICFileGetSectionValue(const char* path, const char* section, const char* key, char* buffer,
                             int size);
/* Replaces the whole section, or appends it, by `values`, each written with `line_format` (two
 * "%s": key and value; NULL: the default "%s=\"%s\"\n"). `reserved` is 0. Positive, or negative on
 * failure. */
int KAPICFileSetSection(const char* path, const char* section, int reserved, KAPICSzHash values,
                        const char* line_format);
/* Appends a section, without looking for one of that name. 1 or more, else it failed. */
int KAPICFileAddSection(const char* path, const char* section, KAPICSzHash values,
                        const char* line_format);
/* Sets the given keys of an existing section in place and keeps its other keys. The three numbers
 * are 0, 1 and 0. Positive: done; 0: there is no such section, nothing written; negative: failure.
 */
int KAPICIFileModifySection(const char* path, const char* section, int reserved, KAPICSzHash values,
                            int replace, int reserved2);
/* Takes the section out of the file. 1: done; 0: there is no such section; negative: failure. */
int KAPICFileRemoveSection(const char* path, const char* section);
/* Appends the names of all sections, in file order, to `into`. 0 or more, or negative on failure.
 */
int KAPICFileEnumSection(const char* path, KAPICSzList into);

/* ---- Semaphores: mutual exclusion between processes ---- */

/* Opens, or makes, the machine's semaphore of that key (1 or more): a lock file in /run/tarqcore,
 * below the root folder, which only root or the root folder's owner can make, open and hold. An id
 * for the calls below, or negative on failure. */
int KAPICSemOpen(int key);
/* Waits for the semaphore and takes it. The kernel gives it back when the holder dies. 0, or
 * negative on failure: errno EWOULDBLOCK when it was not free within 20 seconds. The system log
 * then names the file, and who holds it. */
int KAPICSemLock(int id);
/* Gives it back. 0, or negative on failure: errno EPERM when the process does not hold it. */
int KAPICSemUnlock(int id);
/* Ends the use of an id; the semaphore itself stays. 0, or negative on failure. */
int KAPICSemClose(int id);

/* ---- Processes ---- */

/* Runs `program` with the given arguments (strings, then NULL; without the program's own name),
 * with a pipe from its standard output (mode "r") or to its standard input ("w"), without a shell.
 * The stream, or NULL when the program cannot be started. Close with KAPICPclose.
 *
 * A program below /usr/local/bin, where the maker's systems have their tools, is looked for in
 * /usr/bin when it is not there (both below the root folder, see root_path.h). When that lacks it
 * too the call fails, the first time; a process that asks again is given a stream without a byte
 * and, at its close, wait status 1 of a program: what is not installed is an error once, and not at
 * every run. */
FILE* KAPICPopen(const char* program, const char* mode, ... /* arguments, NULL */);
/* Closes the stream and waits for the program. Its wait status as waitpid() gives it, or -1. */
int KAPICPclose(FILE* stream);
/* 1 when the pid file names a process that is alive, else 0. */
int KAPICProcAliveByPidFile(const char* path);
/* 1 on the small single-bay device family, else 0: always 0 on stock Linux, unless
 * /usr/tarq/etc/tarqcore.conf, section "device", says mini_unit="yes". */
int KAPICIsMiniUnit(void);

#pragma GCC visibility pop
#ifdef __cplusplus
}
#endif

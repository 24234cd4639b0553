/*
 * Core C library of the appliance: errors and logs, key=value files, processes and
 * string lists.  Every call has C linkage.
 *
 * Errors: every failing call sets the calling thread's last error (code from
 * kyto_errors.h, source file, source line); successful calls leave it alone.
 */
#ifndef KYTOPLATFORM_KLIBC_H
#define KYTOPLATFORM_KLIBC_H

#include <sys/types.h>

#include "kyto_errors.h"

/* Built with hidden symbols by default: every call declared here is exported. */
#pragma GCC visibility push(default)

#ifdef __cplusplus
extern "C" {
#endif

/* ---- Errors and logs ---------------------------------------------------------------- */

/* Last error code of this thread, 0 when none was set. */
int KLIBCErrGet(void) KYTO_NOEXCEPT;
/* Source file and line where the last error was set ("" and 0 when none). */
const char* KLIBCErrorGetFile(void) KYTO_NOEXCEPT;
int KLIBCErrorGetLine(void) KYTO_NOEXCEPT;
/* Sets this thread's last error; the file name is copied (cut to 255 bytes). */
void KLIBCErrSetEx(int code, const char* file, int line) KYTO_NOEXCEPT;
/* Appends text and a newline to logPath (created 0644) with one write(2) in O_APPEND
 * mode.  0 ok, -1 error. */
int KLIBCErrLogSet(const char* logPath, const char* text) KYTO_NOEXCEPT;

/* ---- Key=value files ---------------------------------------------------------------- */
/*
 * Lines have the form key=value or key="value".  Blank lines and lines starting with '#'
 * are kept untouched.  A line may be at most KLIBC_KV_MAX_LINE bytes long (newline not
 * counted); a longer line makes the whole file unreadable (KYTO_ERR_LINE_TOO_LONG).
 *
 * Parsing: the key is the text before the first '=', the value everything after it.
 * Blanks (space, tab, CR) around the key and around the value are ignored, then one pair
 * of double quotes enclosing the whole value is removed (inner quotes stay).  A line whose
 * first non-blank character is '#' is a comment; a line without '=' matches no key.
 * A folder in place of the file is an unreadable file (KYTO_ERR_FILE_OPEN); a missing one
 * gives KYTO_ERR_FILE_NOT_FOUND.
 */
#define KLIBC_KV_MAX_LINE 65536

/* Copies the value of the first line for key (quotes removed) into buf, cut to size - 1
 * bytes and NUL-terminated.  Returns the number of bytes copied (an empty value reads as
 * 0), 0 when the key is absent, -1 when the file cannot be read or an argument is bad
 * (NULL pointer, empty key, size < 1, flags != 0).  On -1 buf is left untouched; when the
 * key is absent buf holds "".  With size 1 nothing fits: buf is "" and the result 0. */
int KLIBCFileGetKeyValue(const char* path, const char* key, char* buf, int size,
                         int flags) KYTO_NOEXCEPT;
/* Replaces the first line for key in place (or appends one), keeping every other line and
 * their order; creates the file (0644) when missing.  lineFormat is a printf format with
 * exactly two %s (key, value); NULL means "%s=\"%s\"\n".  The content is written to a
 * temporary file in the same folder and renamed over the old one, so a reader never sees
 * a torn or missing file.  Keys may not contain '=', '\n', start with '#' or begin or
 * end with a blank; values may not contain '\n'.  A line made by a format without a
 * trailing newline gets one.  An existing file keeps its permission bits (a symbolic link
 * at path is replaced by a regular file); a new one is 0644.  Every other line, the last
 * one's missing newline included, is kept byte for byte.  Writers are not serialised:
 * of two concurrent updates the later rename wins.  Returns 1 on success, -1 on error
 * (the temporary file is always removed). */
int KLIBCFileSetKeyValue(const char* path, const char* key, const char* value,
                         const char* lineFormat) KYTO_NOEXCEPT;
/* 1 when the path exists (file or folder, symbolic links followed), 0 otherwise (NULL:
 * 0 with KYTO_ERR_BAD_PARAMETER; a path that does not exist is not an error). */
int KLIBCFileExist(const char* path) KYTO_NOEXCEPT;

/* ---- Processes ---------------------------------------------------------------------- */

/* fork, exec prog with the non-NULL arguments (the first NULL ends the list; no shell),
 * wait.  argv[0] is prog.  The child's standard input is /dev/null, its signal mask is
 * cleared; other descriptors are inherited as they are (every descriptor of this library
 * is close-on-exec).  Returns the exit status 0..255; -1 when it cannot fork or wait, or
 * the child died by a signal (KYTO_ERR_EXEC).  A program that cannot be executed exits
 * with 127, and the last error is then KYTO_ERR_EXEC. */
int KLIBCExec(const char* prog, const char* a1, const char* a2, const char* a3,
              const char* a4) KYTO_NOEXCEPT;
/* The same with a NULL-terminated argv (argv[0] included).  With blWait 0 the child's pid
 * is returned without waiting (the caller reaps it). */
int KLIBCExecv(const char* prog, char* const argv[], int blWait) KYTO_NOEXCEPT;
/* The decimal pid held in the file; 0 when the content is not a positive number; -1 when
 * the file is missing or unreadable.  Accepted content: digits only, optionally followed
 * by blanks and newlines, value 1..INT_MAX; anything else (leading blanks, a sign, other
 * text, more than 64 bytes) gives 0 with KYTO_ERR_NOT_FOUND. */
int KLIBCReadPidFile(const char* path) KYTO_NOEXCEPT;
/* 1 when the pid in the file names a live process (signal 0 succeeds), 0 otherwise. */
int KLIBCIsProcAlive(const char* pidFile) KYTO_NOEXCEPT;
/* Signals the pid in the file: SIGTERM, or SIGKILL when blForce is non-zero.  0 ok, -1
 * error. */
int KLIBCKill(const char* pidFile, int blForce) KYTO_NOEXCEPT;

/* ---- String lists ------------------------------------------------------------------- */

/* A growable list of C strings, allocated as one object (header and pointer array); each
 * item is a separately allocated copy owned by the list. */
typedef struct _tag_KLIBC_SZLIST {
    int nItem;        /* items in use */
    int nAlloc;       /* capacity of pszItem */
    char* pszItem[1]; /* nAlloc entries */
} KLIBC_SZLIST, *PKLIBC_SZLIST;

/* NULL on bad size (< 1) or no memory. */
PKLIBC_SZLIST KLIBCSzListAlloc(int capacity) KYTO_NOEXCEPT;
/* Splits text at any character of delims and appends the pieces (empty ones included)
 * to *list, growing it (realloc, *list may move) when full.  Returns the count of items
 * appended, -1 on error. */
int KLIBCStrSep(const char* text, const char* delims, PKLIBC_SZLIST* list) KYTO_NOEXCEPT;
/* Joins the items with sep into *buf, growing it with realloc (updating *bufSize) when
 * needed; *buf may be NULL with *bufSize 0.  Returns the length, -1 on error. */
int KLIBCSzListJoin(PKLIBC_SZLIST list, const char* sep, char** buf, int* bufSize) KYTO_NOEXCEPT;
/* Frees the list and its items; NULL is fine. */
void KLIBCSzListFree(PKLIBC_SZLIST list) KYTO_NOEXCEPT;

#ifdef __cplusplus
}
#endif

#pragma GCC visibility pop

#endif

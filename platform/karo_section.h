/* Section files, string hashes and lists, formatted strings and System V
 * semaphores of the host platform layer.
 *
 * A section file is text: "[Section]" lines, each followed by its pairs, one
 * per line, written as "\tkey=\"value\"\n". Reading tolerates blank lines,
 * lines starting with '#', spaces around names, keys and values, and
 * unquoted values. Every write replaces the file atomically (temporary file
 * in the same directory, fsync, rename), so a reader never sees a
 * half-written file and a writer killed at any moment leaves either the old
 * or the new file (and perhaps a stray ".name.XXXXXX" temporary file). A
 * rewrite keeps the content, not comments or spacing.
 *
 * What the format cannot hold is refused with KERR_VALUE_UNHOLDABLE and
 * nothing is written: a section name or key that is empty, starts with '#',
 * has leading or trailing blanks, or holds a line break or '[' or ']' (keys
 * also '=' and '"'); a value holding a line break. A value may hold double
 * quotes and blanks: everything between the first quote after '=' and the
 * last quote of the line is the value.
 *
 * File paths given to these functions are used as they are: callers resolve
 * fixed system paths under the root first (karo_root.h). None of the file
 * functions locks: writers serialise with a semaphore of their own choosing.
 *
 * Every failure returns -1 (or NULL) and sets the platform error
 * (karo_err.h). Thread-safety: objects are used by one thread at a time. */
#ifndef KARO_SECTION_H_
#define KARO_SECTION_H_

#include <stdarg.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The hash and list calls marked KARO_C_EXPORT are also part of libs2s's C
 * interface (S2S/is_syncedshare.h): C programs build with them the sections
 * that the registry functions take. */
#define KARO_C_EXPORT __attribute__((visibility("default")))

/* ---- String hash: an insertion-ordered map of string keys to values. ---- */
typedef struct KSZHASH KSZHASH;

/* Returns an empty hash that holds at most `capacity` keys, or NULL
 * (KERR_NO_MEMORY, KERR_INVALID_ARG for capacity < 1). */
KARO_C_EXPORT KSZHASH* KLIBCSzHashAlloc(int capacity);
/* Frees the hash and its strings; NULL is ignored. */
KARO_C_EXPORT void KLIBCSzHashFree(KSZHASH* hash);
/* Sets `key` to a copy of `value` (replacing an older value in place).
 * Returns 0, or -1: KERR_INVALID_ARG (null argument), KERR_NO_MEMORY (the
 * capacity is reached). */
KARO_C_EXPORT int KLIBCSzHashSetValue(KSZHASH* hash, const char* key,
                                      const char* value);
/* Returns the value of `key` (owned by the hash), or NULL when absent
 * (KERR_NOT_FOUND) or on a null argument (KERR_INVALID_ARG). */
KARO_C_EXPORT const char* KLIBCSzHashGetValue(const KSZHASH* hash,
                                              const char* key);
/* Removes `key`; 0, or -1 with KERR_NOT_FOUND. */
int KLIBCSzHashRemove(KSZHASH* hash, const char* key);
/* Number of keys; 0 for NULL. */
KARO_C_EXPORT int KLIBCSzHashCount(const KSZHASH* hash);
/* Key and value of the i-th pair in insertion order, or NULL when out of
 * range. */
KARO_C_EXPORT const char* KLIBCSzHashKeyAt(const KSZHASH* hash, int i);
KARO_C_EXPORT const char* KLIBCSzHashValueAt(const KSZHASH* hash, int i);
/* Removes every pair. */
void KLIBCSzHashClear(KSZHASH* hash);

/* ---- String list: an ordered list of strings. ---- */
typedef struct KSZLIST KSZLIST;

/* Returns an empty list, or NULL (KERR_NO_MEMORY). */
KARO_C_EXPORT KSZLIST* KLIBCSzListAlloc(void);
/* Frees the list and its strings; NULL is ignored. */
KARO_C_EXPORT void KLIBCSzListFree(KSZLIST* list);
/* Appends a copy of `s`; 0, or -1 (KERR_INVALID_ARG, KERR_NO_MEMORY). */
KARO_C_EXPORT int KLIBCSzListPush(KSZLIST* list, const char* s);
/* Number of strings; 0 for NULL. */
KARO_C_EXPORT int KLIBCSzListCount(const KSZLIST* list);
/* The i-th string (owned by the list), or NULL when out of range. */
KARO_C_EXPORT const char* KLIBCSzListGet(const KSZLIST* list, int i);

/* ---- Formatted strings. ---- */
/* Returns a newly allocated string formatted like printf, or NULL
 * (KERR_NO_MEMORY, KERR_INVALID_ARG). Release it with KLIBCStrPut. */
char* KLIBCStrGet(const char* format, ...)
    __attribute__((format(printf, 1, 2)));
/* Releases a string from KLIBCStrGet; NULL is ignored. */
void KLIBCStrPut(char* s);

/* ---- Files and sections. ---- */
/* The default pair format, and the only one the writers accept. */
#define KLIBC_SECTION_PAIR_FORMAT "\t%s=\"%s\"\n"

/* 1 when `path` exists, else 0. */
int KLIBCFileExist(const char* path);

/* Adds the pairs of `section` to `out` (existing keys are overwritten).
 * Returns 1 when the section exists, 0 when the file has no such section,
 * -1 on failure: KERR_FILE_NOT_FOUND (no file), KERR_FILE_FORMAT (a line
 * that cannot be parsed), KERR_NO_MEMORY (the hash is full),
 * KERR_INVALID_ARG. */
int KLIBCFileGetSection(const char* file, const char* section, KSZHASH* out);

/* Copies the value of `key` in `section` into `buf` (`size` bytes, NUL
 * included). Returns the value's length, or -1: KERR_FILE_NOT_FOUND,
 * KERR_NOT_FOUND (no such section or key), KERR_BUFFER_TOO_SMALL,
 * KERR_FILE_FORMAT, KERR_INVALID_ARG. */
int KLIBCFileGetSectionValue(const char* file, const char* section,
                             const char* key, char* buf, int size);

/* Replaces the whole content of an existing `section` with `values`.
 * `format` is NULL or KLIBC_SECTION_PAIR_FORMAT; `flags` must be 0.
 * Returns the number of pairs written (>= 0), or -1: KERR_NOT_FOUND (no such
 * section; nothing written), KERR_FILE_NOT_FOUND, KERR_VALUE_UNHOLDABLE,
 * KERR_INVALID_ARG, KERR_SYSTEM. */
int KLIBCFileSetSection(const char* file, const char* section, int flags,
                        const KSZHASH* values, const char* format);

/* Sets the pairs of `values` in an existing `section`, keeping its other
 * keys; with `create_file` nonzero a missing file is created first. `flags`
 * and `reserved` must be 0. Returns 1 when the section was modified, 0 when
 * it does not exist (nothing written), -1 on failure as for
 * KLIBCFileSetSection. */
int KLIBCIFileModifySection(const char* file, const char* section, int flags,
                            const KSZHASH* values, int create_file,
                            int reserved);

/* Appends `section` with `values` at the end of the file (creating the file
 * if needed); when the section already exists its content is replaced
 * instead, so adding twice never duplicates a section. `format` is NULL or
 * KLIBC_SECTION_PAIR_FORMAT. Returns 1, or -1 on failure as for
 * KLIBCFileSetSection. */
int KLIBCFileAddSection(const char* file, const char* section,
                        const KSZHASH* values, const char* format);

/* Appends the name of every section, in file order, to `out`. Returns the
 * number of sections, or -1 (KERR_FILE_NOT_FOUND, KERR_FILE_FORMAT, ...). */
int KLIBCFileEnumSection(const char* file, KSZLIST* out);

/* ---- System V semaphores (binary, with SEM_UNDO). ---- */
/* Opens the semaphore set of `key` (not IPC_PRIVATE), creating it with value
 * 1 when it does not exist yet; a set another process is still creating is
 * waited for. Returns a handle >= 0, or -1 (KERR_LOCK). */
int KLIBCSemOpen(int key);
/* Takes the semaphore, waiting as long as needed; the kernel gives it back if
 * the process dies holding it. 0, or -1 (KERR_LOCK). */
int KLIBCSemLock(int handle);
/* KLIBCSemLock waiting at most `timeout_ms` milliseconds (negative: as long
 * as needed, 0: not at all). 0, or -1 (KERR_LOCK) when the time ran out. */
int KLIBCSemLockTimed(int handle, int timeout_ms);
/* Gives it back; only the holder may call it. 0, or -1 (KERR_LOCK). */
int KLIBCSemUnlock(int handle);
/* Forgets the handle (the semaphore itself stays for other processes);
 * 0, or -1 for an invalid handle. */
int KLIBCSemClose(int handle);
/* Makes `uid`/`gid` the owner of the semaphore (mode stays 0600), so that
 * processes of that user may open it too; only its owner or root may. 0
 * (also when they own it already), or -1 (KERR_LOCK). */
int KLIBCSemSetOwner(int handle, unsigned int uid, unsigned int gid);

#ifdef __cplusplus
}
#endif

#endif /* KARO_SECTION_H_ */

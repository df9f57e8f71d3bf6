// Core platform library: string lists, text splitting, key/value files,
// command execution and a per-thread error state.
//
// Every call that fails records an error code with the file and line where
// it failed in the calling thread's error state (KLIBCErrGet and friends);
// a call that succeeds leaves the error state as it was.
#ifndef ZARK_PLATFORM_KLIBC_H
#define ZARK_PLATFORM_KLIBC_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

// Error codes of the core library (KLIBCErrGet).
enum {
  KLIBC_ERR_NONE = 0x0000,           // no error recorded
  KLIBC_ERR_OUT_OF_MEMORY = 0x0200,  // an allocation failed
  KLIBC_ERR_FILE_OPEN = 0x0400,      // a file could not be opened
  KLIBC_ERR_FILE_READ = 0x0401,      // a read from an open file failed
  KLIBC_ERR_FILE_WRITE = 0x0402,     // writing or replacing a file failed
  KLIBC_ERR_FILE_NOT_FOUND = 0x0403, // the file does not exist
  KLIBC_ERR_EXEC = 0x0600,           // a command could not be run
  KLIBC_ERR_OUT_OF_RANGE = 0x0B00,   // an index past the end of a list
  KLIBC_ERR_BAD_PARAMETER = 0x0D00,  // a null or otherwise invalid argument
  KLIBC_ERR_TOO_LARGE = 0x0E00,      // a list or a file would exceed its hard
                                     // limit (1<<20 items, 4 MiB)
};

// A growable list of NUL-terminated strings. The list owns its strings.
// nItem is the number of items; the rest of the record is private to the
// library. Functions that may grow the list take its address, because
// growing may move it.
typedef struct _tag_KLIBSZLIST_ {
  int32_t nItem;
  int32_t nAlloc;
  char **ppszItem;
} KLIBSZLIST, *PKLIBSZLIST;

// Allocates an empty list with room for `capacity` items (at least 1).
// Returns NULL with KLIBC_ERR_BAD_PARAMETER for a negative capacity,
// KLIBC_ERR_TOO_LARGE for one above the hard limit of 1<<20 items, or
// KLIBC_ERR_OUT_OF_MEMORY.
KLIBSZLIST *KLIBCSzListAlloc(int capacity);

// Frees a list and all its strings. NULL is accepted and ignored.
void KLIBCSzListFree(KLIBSZLIST *list);

// Returns item i, or NULL (KLIBC_ERR_OUT_OF_RANGE / KLIBC_ERR_BAD_PARAMETER)
// when i is not an index of the list.
const char *KLIBCSzListGet(const KLIBSZLIST *list, int i);

// Removes item i, keeping the order of the rest. Returns 0, or -1 with the
// error set when i is not an index of the list.
int KLIBCSzListRemove(KLIBSZLIST *list, int i);

// Removes every item. Returns 0, or -1 for a NULL list.
int KLIBCSzListRemoveAll(KLIBSZLIST *list);

// Appends a copy of text, growing the list (and possibly moving it: *list
// is updated). Returns the new item's index, or -1 with the error set
// (KLIBC_ERR_BAD_PARAMETER for a NULL argument, KLIBC_ERR_TOO_LARGE when the
// list holds 1<<20 items already, KLIBC_ERR_OUT_OF_MEMORY); the list is then
// unchanged.
int KLIBCSzListPush(KLIBSZLIST **list, const char *text);

// Returns the index of the first item equal to text, or -1 when absent
// (or on a NULL argument, with KLIBC_ERR_BAD_PARAMETER).
int KLIBCSzListFind(const KLIBSZLIST *list, const char *text);

// Sorts the items by strcmp, ascending when ascending is non-zero, else
// descending. The sort is stable. Returns 0, or -1 for a NULL list.
int KLIBCSzListSortItems(KLIBSZLIST *list, int ascending);

// Splits text at every character of sep (a set of separator characters)
// and appends the pieces, empty pieces included ("a,,b" gives "a", "", "b";
// "a," gives "a", ""). An empty text has no pieces; an empty sep makes the
// whole text one piece. Returns the number of pieces appended, or -1 with
// the error set (KLIBC_ERR_BAD_PARAMETER for a NULL argument, or as
// KLIBCSzListPush); on failure nothing is appended.
int KLIBCStrSep(const char *text, const char *sep, KLIBSZLIST **list);

// Like KLIBCStrSep but skips empty pieces (",a,,b," gives "a", "b").
int KLIBCStrTok(const char *text, const char *sep, KLIBSZLIST **list);

// Key/value files. A file is read line by line:
//   [section]        starts a section (name without the brackets, trimmed)
//   key=value        a value, blanks around key and value trimmed
//   key="value"      a quoted value, kept exactly between the first and
//                    the last quote (blanks, "=", "#" included)
//   # or ;           a comment line
// Lines end with "\n" or "\r\n". Anything after the "]" of a header is
// ignored; there are no comments after a value. Other lines (no "=", an
// empty key, a header without "]") are ignored. Keys are case-sensitive.
// Files larger than 4 MiB are refused.
//
// Errors of reading the file: KLIBC_ERR_FILE_NOT_FOUND (it does not exist),
// KLIBC_ERR_FILE_OPEN (it cannot be opened or is not a regular file),
// KLIBC_ERR_FILE_READ, KLIBC_ERR_TOO_LARGE (over 4 MiB),
// KLIBC_ERR_OUT_OF_MEMORY.
//
// KLIBCFileGetKeyValue finds the first line whose key equals `key` (in any
// section when flags is 0) and copies its value into buf (cut to size-1
// bytes, always NUL-terminated). Returns the number of bytes copied, 0 when
// the key is absent or its value empty (buf then holds ""), or -1 with the
// error set when the file cannot be read or an argument is invalid
// (KLIBC_ERR_BAD_PARAMETER: NULL file, key or buf, an empty key, a size
// below 1, or flags other than 0, the only value defined).
int KLIBCFileGetKeyValue(const char *file, const char *key, char *buf, int size,
                         int flags);

// Sets key to value in the file (creating the file when it is missing),
// replacing the first line with that key, in any section, or appending a
// new line at the end of the file (so into its last section). The value is
// written quoted when it has leading or trailing blanks or begins with a
// quote, so that reading gives it back unchanged. The file is replaced
// atomically (temporary file in the same folder, fsync, rename), keeping
// the old file's mode (and owner, for a privileged caller), or 0644 for a
// new file; a symbolic link is kept and its target rewritten. Returns 0, or
// -1 with the error set: KLIBC_ERR_BAD_PARAMETER (NULL or empty file, NULL
// value, a key that is empty, has blanks around it, contains "=" or a line
// break, or begins with "#", ";" or "[", a value with a line break, flags
// other than 0), KLIBC_ERR_FILE_WRITE (the temporary file cannot be made,
// written or renamed; the old file is then unchanged), KLIBC_ERR_TOO_LARGE
// (the result would exceed 4 MiB), or an error of reading the old file
// other than KLIBC_ERR_FILE_NOT_FOUND.
int KLIBCFileSetKeyValue(const char *file, const char *key, const char *value,
                         int flags);

// Appends the names of all sections of the file, in file order, each name
// once (at its first header). Returns the number of names appended, or -1
// with the error set (KLIBC_ERR_BAD_PARAMETER for a NULL argument, an error
// of reading the file, or as KLIBCSzListPush); on failure nothing is
// appended.
int KLIBCFileEnumSection(const char *file, KLIBSZLIST **list);

// Returns 1 when path exists (symbolic links followed: a dangling link does
// not exist), 0 when it does not, -1 with the error set when existence
// cannot be decided: KLIBC_ERR_BAD_PARAMETER for a NULL path,
// KLIBC_ERR_FILE_OPEN otherwise (permission denied, a loop of links, a name
// too long).
int KLIBCFileExist(const char *path);

// Runs a command line with /bin/sh -c and waits for it. The shell starts
// with every signal at its default action and none blocked. Returns -1 with
// KLIBC_ERR_EXEC when the shell could not be started, was killed by a
// signal, or its status was lost (SIGCHLD ignored in this process), -1 with
// KLIBC_ERR_BAD_PARAMETER for a NULL command, else the command's exit
// status (0..255; 127 when the shell cannot find the command).
int KLIBCSystem(const char *command);

// The calling thread's error state: code, source file and line of the last
// recorded failure. KLIBCErrSetEx records one (file may be NULL, read back
// as ""); KLIBCErrGet returns 0, KLIBCErrorGetFile "" and KLIBCErrorGetLine
// 0 while nothing was recorded. KLIBCErrorGetFile returns the thread's own
// copy of the file text (at most 255 characters kept), valid as long as the
// thread lives; its text changes with the next recorded failure.
void KLIBCErrSetEx(int code, const char *file, int line);
int KLIBCErrGet(void);
const char *KLIBCErrorGetFile(void);
int KLIBCErrorGetLine(void);

#ifdef __cplusplus
}
#endif

#endif

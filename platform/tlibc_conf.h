// Platform utilities: key=value configuration files, text trimming and
// growable lists of texts.
//
// Configuration files hold one setting per line, "key=value" or
// "key=\"value\""; blank lines and lines starting with '#' are kept as they
// are. Writes replace the whole file atomically (a temporary file beside it,
// flushed to disk, then renamed over it), so a crash or a full disk leaves
// either the old or the new file, never a partial one.
#ifndef TARN_TLIBC_CONF_H
#define TARN_TLIBC_CONF_H

#include <cstddef>

// Reads the value of key from file into buffer (at most size - 1 characters,
// always NUL-terminated when size > 0). Surrounding blanks of the value and
// one pair of enclosing double quotes are removed.
// Returns the length of the value copied, 0 when the key is missing (or its
// value is empty), -1 when the file cannot be read or an argument is bad.
// flags is reserved (pass 0).
int TLIBCFileGetKeyValue(const char *file, const char *key, char *buffer, size_t size, int flags);

// Sets key to value in file. The line written is lineFormat filled with key
// and value (lineFormat must hold exactly two "%s" conversions and nothing
// else but "%%"; null means "%s=%s\n"). The first line with that key is
// replaced and later lines with the same key are dropped; a missing key is
// appended. The file and its parent directories are created when missing.
// Returns 0 on success, -1 on failure (the file is then unchanged).
int TLIBCFileSetKeyValue(const char *file, const char *key, const char *value,
                         const char *lineFormat);

// Removes blanks (space, tab, CR, LF, VT, FF) at both ends of text in place.
// Returns the new length, or -1 for a null text. flags is reserved (pass 0).
int TLIBCStrTrimSpace(char *text, int flags);

// A growable list of texts.
struct TLIBC_SZLIST {
    int count;        // number of items
    int capacity;     // number of item slots allocated
    char **items;     // item texts, each separately allocated
};

// A list with room for initialCapacity items (at least 1), or null.
TLIBC_SZLIST *TLIBCSzListAlloc(int initialCapacity);
// Appends a copy of text (the list grows as needed). 0, or -1 on failure.
int TLIBCSzListAdd(TLIBC_SZLIST **list, const char *text);
// Item i, or null when i is out of range or the list is null.
const char *TLIBCSzListGet(const TLIBC_SZLIST *list, int i);
// Number of items (0 for a null list).
int TLIBCSzListCount(const TLIBC_SZLIST *list);
// Sorts the items by byte value: ascending when ascending is non-zero,
// descending otherwise. 0, or -1 for a null list.
int TLIBCSzListSortItems(TLIBC_SZLIST *list, int ascending);
// Frees the list and its items (null is allowed).
void TLIBCSzListFree(TLIBC_SZLIST *list);

// Splits text at every character of separators and appends each non-empty
// piece to *list. text itself is not changed. Returns the number of pieces
// added, or -1 on a bad argument or allocation failure.
int TLIBCStrSep(const char *text, const char *separators, TLIBC_SZLIST **list);

// A positive number from key of the system's configuration file
// (TARN_INFO_CONF), or fallback when the key is absent, empty, not a number
// or not positive. The file is read at each call.
unsigned long TarnConfNumber(const char *key, unsigned long fallback);

#endif

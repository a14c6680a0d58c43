// String lists and text tests of the utility library.
//
// Thread-safety: the routines keep no shared state; a list must not be used
// from two threads at once.
#ifndef ZEPH_QLIBC_STRING_H_
#define ZEPH_QLIBC_STRING_H_

#include <memory>

#include "zeph/export.h"

// A growable list of strings. `count` strings are held; each is a
// NUL-terminated copy owned by the list.
typedef struct QLIBSZLIST {
  int count;
  int capacity;
  char** items;
} QLIBSZLIST;

extern "C" {

// A new, empty list with room for `capacity` strings (it grows beyond that).
// Null when `capacity` is below 1 or memory is short.
ZEPH_EXPORT QLIBSZLIST* QLIBCSzListAlloc(int capacity);

// Frees the list and its strings; accepts null.
ZEPH_EXPORT void QLIBCSzListFree(QLIBSZLIST* list);

// Appends a copy of `text`. 0 on success, -1 on a bad argument or no memory.
ZEPH_EXPORT int QLIBCSzListAdd(QLIBSZLIST* list, const char* text);

// The i-th string, or null when `i` is out of range.
ZEPH_EXPORT const char* QLIBCSzListGet(const QLIBSZLIST* list, int i);

// Splits `text` at every character of `separators` and appends each piece,
// empty pieces included, in order: "a;;b" gives "a", "", "b" and "" gives one
// empty piece. 0 on success, -1 on a null argument or no memory.
ZEPH_EXPORT int QLIBCStrSep(const char* text, const char* separators,
                            QLIBSZLIST* list);

// 1 when `text` is an IPv4 address in dotted form or an IPv6 address, else 0.
ZEPH_EXPORT int BlQLIBIsIpAddr(const char* text);

}  // extern "C"

namespace ZEPH {
struct SzListDeleter {
  void operator()(QLIBSZLIST* list) const { QLIBCSzListFree(list); }
};
using UniqueSzList = std::unique_ptr<QLIBSZLIST, SzListDeleter>;
}  // namespace ZEPH

#endif  // ZEPH_QLIBC_STRING_H_

// Feature switches of the appliance.
//
// Features are lines "key=yes" in <root>/usr/zeph/etc/features.conf. Blank
// lines and lines starting with "#" are ignored; blanks around key and value
// are not significant.
//
// Thread-safety: safe from any thread; the file is read at every call.
#ifndef ZEPH_QLIBC_SUPPORT_H_
#define ZEPH_QLIBC_SUPPORT_H_

#include "zeph/export.h"

extern "C" {

// 1 when the feature `key` is switched on, 0 when it is off, absent, or the
// file is missing.
ZEPH_EXPORT int QLIBCSupportGet(const char* key);

}  // extern "C"

#endif  // ZEPH_QLIBC_SUPPORT_H_

// The platform utility library, all of it.
#ifndef ZEPH_QLIBC_H_
#define ZEPH_QLIBC_H_

#include "zeph/qlibc_error.h"
#include "zeph/qlibc_exec.h"
#include "zeph/qlibc_file.h"
#include "zeph/qlibc_lock.h"
#include "zeph/qlibc_string.h"
#include "zeph/qlibc_support.h"

#endif  // ZEPH_QLIBC_H_

// The method table of the certificate module and its one entry point.
#ifndef ZEPH_MODULE_FRAME_TABLE_H_
#define ZEPH_MODULE_FRAME_TABLE_H_

#include "zeph/api_table.h"
#include "zeph/export.h"

// The 15 rows the module serves, in the order the server sees them, ended by
// an all-zero row. Constant for the life of the process.
extern const ZEPH_API_TABLE gTable[];

// Returns the first row of gTable.
extern "C" ZEPH_EXPORT const ZEPH_API_TABLE* GetAPITable();

#endif  // ZEPH_MODULE_FRAME_TABLE_H_

// The method table that an API module hands its server.
//
// A module exports `extern "C" const ZEPH_API_TABLE* GetAPITable()`. The
// table is an array of rows ended by a row whose fields are all zero; it is
// constant for the life of the process.
#ifndef ZEPH_API_TABLE_H_
#define ZEPH_API_TABLE_H_

#include <stdint.h>

#include "zeph/api.h"

typedef void (*ZEPH_API_HANDLER)(ZEPH::APIRequest* request,
                                 ZEPH::APIResponse* response);

typedef struct ZEPH_API_TABLE {
  const char* api;           // API name, e.g. "ZEPH.Core.Certificate.CRT"
  int32_t version;           // method version
  const char* method;        // method name, e.g. "list"
  ZEPH_API_HANDLER handler;  // called with the request and the response
} ZEPH_API_TABLE;

typedef const ZEPH_API_TABLE* (*ZEPH_GET_API_TABLE)();

#define ZEPH_GET_API_TABLE_SYMBOL "GetAPITable"

#endif  // ZEPH_API_TABLE_H_

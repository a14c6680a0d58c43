#include "zeph/qlibc_string.h"

#include <arpa/inet.h>
#include <stdlib.h>
#include <string.h>

#include "zeph/qlibc_error.h"

extern "C" {

QLIBSZLIST* QLIBCSzListAlloc(int capacity) {
  if (capacity < 1) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return nullptr;
  }
  auto* list = static_cast<QLIBSZLIST*>(calloc(1, sizeof(QLIBSZLIST)));
  if (list == nullptr) {
    QLIBC_SET_ERROR(QLIBC_ERR_NO_MEMORY);
    return nullptr;
  }
  list->items = static_cast<char**>(calloc(static_cast<size_t>(capacity), sizeof(char*)));
  if (list->items == nullptr) {
    free(list);
    QLIBC_SET_ERROR(QLIBC_ERR_NO_MEMORY);
    return nullptr;
  }
  list->capacity = capacity;
  return list;
}

void QLIBCSzListFree(QLIBSZLIST* list) {
  if (list == nullptr) return;
  for (int i = 0; i < list->count; ++i) free(list->items[i]);
  free(list->items);
  free(list);
}

int QLIBCSzListAdd(QLIBSZLIST* list, const char* text) {
  if (list == nullptr || text == nullptr) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return -1;
  }
  if (list->count == list->capacity) {
    int grown = list->capacity * 2;
    auto* items = static_cast<char**>(realloc(list->items, static_cast<size_t>(grown) * sizeof(char*)));
    if (items == nullptr) {
      QLIBC_SET_ERROR(QLIBC_ERR_NO_MEMORY);
      return -1;
    }
    list->items = items;
    list->capacity = grown;
  }
  char* copy = strdup(text);
  if (copy == nullptr) {
    QLIBC_SET_ERROR(QLIBC_ERR_NO_MEMORY);
    return -1;
  }
  list->items[list->count++] = copy;
  return 0;
}

const char* QLIBCSzListGet(const QLIBSZLIST* list, int i) {
  if (list == nullptr || i < 0 || i >= list->count) return nullptr;
  return list->items[i];
}

int QLIBCStrSep(const char* text, const char* separators, QLIBSZLIST* list) {
  if (text == nullptr || separators == nullptr || list == nullptr) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return -1;
  }
  const char* start = text;
  for (;;) {
    size_t len = strcspn(start, separators);
    char* piece = strndup(start, len);
    if (piece == nullptr) {
      QLIBC_SET_ERROR(QLIBC_ERR_NO_MEMORY);
      return -1;
    }
    int rc = QLIBCSzListAdd(list, piece);
    free(piece);
    if (rc != 0) return -1;
    if (start[len] == '\0') return 0;
    start += len + 1;
  }
}

int BlQLIBIsIpAddr(const char* text) {
  if (text == nullptr) return 0;
  unsigned char buf[sizeof(struct in6_addr)];
  if (inet_pton(AF_INET, text, buf) == 1) return 1;
  if (inet_pton(AF_INET6, text, buf) == 1) return 1;
  return 0;
}

}  // extern "C"

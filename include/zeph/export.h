// Symbol visibility for the shared objects of the product.
//
// Everything is built with -fvisibility=hidden; only what is marked with
// ZEPH_EXPORT leaves a shared object. Other components look these names up
// with dlsym, so exported functions use C linkage where they say so.
#ifndef ZEPH_EXPORT_H_
#define ZEPH_EXPORT_H_

#define ZEPH_EXPORT __attribute__((visibility("default")))

#endif  // ZEPH_EXPORT_H_

// The helpers that other components of the appliance use, under their
// plain C names.
//
// GenCrtChecksum, isPemExpire and IsCrtPathValid have C++ linkage: a C++
// component declares them with their signatures
//   bool GenCrtChecksum(Json::Value&);
//   bool isPemExpire(const std::string&, int);
//   bool IsCrtPathValid(bool, const std::string&, const std::string&);
// and links against the module. Components that look them up with dlsym
// by the plain names find the forwarders of this file, which take the same
// arguments and call the C++ functions. Nothing else needs this header.
#ifndef ZEPH_MODULE_ARCHIVE_C_NAMES_H_
#define ZEPH_MODULE_ARCHIVE_C_NAMES_H_

#include <json/json.h>

#include <string>

#include "zeph/export.h"

extern "C" {

ZEPH_EXPORT bool GenCrtChecksumByCName(Json::Value& list)
    __asm__("GenCrtChecksum");
ZEPH_EXPORT bool isPemExpireByCName(const std::string& path, int days)
    __asm__("isPemExpire");
ZEPH_EXPORT bool IsCrtPathValidByCName(bool local, const std::string& base,
                                       const std::string& name)
    __asm__("IsCrtPathValid");

}  // extern "C"

#endif  // ZEPH_MODULE_ARCHIVE_C_NAMES_H_

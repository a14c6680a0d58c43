// The subject of a key request or certificate to generate.
//
// Seven UTF-8 texts in the order the request configuration lists them. An
// empty text leaves its attribute out of the subject. The record owns its
// strings and has no invariant beyond that.
#ifndef ZEPH_MODULE_MKCERT_CSR_ARGUMENT_H_
#define ZEPH_MODULE_MKCERT_CSR_ARGUMENT_H_

#include <string>

typedef struct _tag_CSR_ARGUMENT {
  std::string country;       // countryName
  std::string state;         // stateOrProvinceName
  std::string city;          // localityName
  std::string organization;  // 0.organizationName
  std::string department;    // organizationalUnitName
  std::string common_name;   // commonName
  std::string email;         // emailAddress
} _tag_CSR_ARGUMENT;

#endif  // ZEPH_MODULE_MKCERT_CSR_ARGUMENT_H_

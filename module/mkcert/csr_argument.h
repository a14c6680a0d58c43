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

// Values go into the openssl configuration files as they are, one per
// line: a line break inside one would add lines of its own to the file
// (an extension, another section). Such values are refused.
inline bool HasLineBreak(const std::string& text) {
  return text.find_first_of("\r\n") != std::string::npos;
}

inline bool SubjectHasLineBreak(const _tag_CSR_ARGUMENT& s) {
  return HasLineBreak(s.country) || HasLineBreak(s.state) ||
         HasLineBreak(s.city) || HasLineBreak(s.organization) ||
         HasLineBreak(s.department) || HasLineBreak(s.common_name) ||
         HasLineBreak(s.email);
}

#endif  // ZEPH_MODULE_MKCERT_CSR_ARGUMENT_H_

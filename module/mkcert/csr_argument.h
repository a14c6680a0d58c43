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

// Calls `f` with each of the seven values, in order, until it returns true;
// true when one did.
template <typename F>
bool AnySubjectValue(const _tag_CSR_ARGUMENT& s, F f) {
  return f(s.country) || f(s.state) || f(s.city) || f(s.organization) ||
         f(s.department) || f(s.common_name) || f(s.email);
}

// Whether `text` is well-formed UTF-8 (no overlong forms, no surrogates,
// nothing above U+10FFFF).
bool IsUtf8(const std::string& text);

// Values that cannot go into a request: a line break (see above), or bytes
// that are not UTF-8, which the tool would refuse or store as nonsense.
inline bool SubjectIsInvalid(const _tag_CSR_ARGUMENT& s) {
  return AnySubjectValue(s, [](const std::string& v) {
    return HasLineBreak(v) || !IsUtf8(v);
  });
}

// Whether every value is plain ASCII.
inline bool SubjectIsAscii(const _tag_CSR_ARGUMENT& s) {
  return !AnySubjectValue(s, [](const std::string& v) {
    for (unsigned char c : v) {
      if (c >= 0x80) return true;
    }
    return false;
  });
}

#endif  // ZEPH_MODULE_MKCERT_CSR_ARGUMENT_H_

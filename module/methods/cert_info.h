// Certificate contents as JSON: names, times and the description of every
// certificate in a PEM file. Used by the list, the signing-request renewal
// and the import.
//
// Thread-safety: the functions keep no state; safe from any thread.
#ifndef ZEPH_MODULE_METHODS_CERT_INFO_H_
#define ZEPH_MODULE_METHODS_CERT_INFO_H_

#include <json/json.h>
#include <openssl/x509.h>

#include <string>

#include "zeph/api.h"
#include "zeph/export.h"

// Adds to `out` the name object of `name`: "country", "state", "city",
// "organization", "department", "common_name" and "email", each only when
// the name holds that attribute (its first occurrence, up to 1023 bytes).
ZEPH_EXPORT void X509_NAME2Json(X509_NAME* name, Json::Value& out);

// Assigns to `out` the text that ASN1_TIME_print writes for `time`, such as
// "Jan  2 03:04:05 2030 GMT"; leaves `out` alone when there is no text.
ZEPH_EXPORT void ASN1_TIME2Json(const ASN1_TIME* time, Json::Value& out);

// The subject alternative names of `cert` as an array of strings: DNS and
// URI names as their text, IP addresses in their textual form (an address
// that is neither 4 nor 16 bytes long gives an empty string), other kinds
// skipped. Empty when the extension is absent.
ZEPH_EXPORT Json::Value SubjectAltNames2Json(X509* cert);

// OpenSSL's long name of the signature algorithm of `cert` ("" if unknown).
ZEPH_EXPORT std::string SignatureAlgorithm(const X509* cert);

// Appends to `out` one object for every PEM certificate in `path`, in file
// order: "issuer", "subject", "signature_algorithm", then "valid_from"
// and/or "valid_till" when the request's "additional" array names them,
// then "type" ("root_cert", "inter_cert" or "server_cert" by the path).
// Returns 0 on success, 3 when the file holds no certificate, 4 when it
// cannot be opened.
ZEPH_EXPORT int getCertificateInfo(std::string path, Json::Value& out,
                                   ZEPH::APIRequest* request);

#endif  // ZEPH_MODULE_METHODS_CERT_INFO_H_

// Certificate sets: the files one certificate directory holds when the
// appliance makes a certificate itself.
//
//   privkey.pem           the server's key                     (genCertSet)
//   cert.pem              the server certificate, signed by    (genCertSet)
//                         the authority below
//   fullchain.pem         a copy of cert.pem, alone            (genCertSet)
//   zeph-ca-cert.pem      the authority's self-signed cert     (genCASet)
//   zeph-ca-privkey.pem   the authority's key                  (genCASet)
//
// Keys are RSA of the length the caller asks for, or, with the *OfType
// forms, of the type the caller asks for (key_type.h).
//
// Both certificates are valid for 366 days. Functions return 0 on success
// and -1 on failure with one log line (source "mkcert"); files made by
// earlier steps stay in the directory, and cleaning it up is the caller's
// business.
//
// Thread-safety: no state is kept in memory and no lock is taken; the
// appliance's fixed working files (request configurations, requests,
// extension files) are shared, so callers hold the generation lock
// (generation_lock.h) around the making of a set.
#ifndef ZEPH_MODULE_MKCERT_CERT_SET_H_
#define ZEPH_MODULE_MKCERT_CERT_SET_H_

#include <string>

#include "module/mkcert/csr_argument.h"
#include "module/mkcert/key_type.h"
#include "zeph/export.h"

// File names of a set inside its directory.
namespace ZEPH {
namespace cert {
constexpr char kSetKey[] = "privkey.pem";
constexpr char kSetCert[] = "cert.pem";
constexpr char kSetFullchain[] = "fullchain.pem";
constexpr char kSetCaCert[] = "zeph-ca-cert.pem";
constexpr char kSetCaKey[] = "zeph-ca-privkey.pem";
}  // namespace cert
}  // namespace ZEPH

// Makes the authority's half of a set in `dir`: a key of `bits` bits and a
// self-signed CA certificate (basicConstraints CA:true, pathlen 0) for
// `subject`, and checks that the two match.
// REQUIRES: dir is an existing directory (refused otherwise, making nothing).
// genCASet answers -2 instead of -1 for invalid input: a subject value
// holding a line break or bytes that are not UTF-8.
ZEPH_EXPORT int genCASet(_tag_CSR_ARGUMENT* subject, int bits,
                         const std::string& dir);

// genCASet with a key of `type` (`bits` counts for kRsa only); for kRsa
// it is genCASet.
ZEPH_EXPORT int genCASetOfType(_tag_CSR_ARGUMENT* subject,
                               ZEPH::cert::KeyType type, int bits,
                               const std::string& dir);

// Makes the server's half of a set in `dir`: a key of `bits` bits, a
// certificate for `subject` with the ";"-separated `aliases` as subject
// alternative names, signed by the authority files already in `dir`, and
// fullchain.pem as a byte copy of cert.pem.
// REQUIRES: genCASet has made the authority files in `dir`.
ZEPH_EXPORT int genCertSet(_tag_CSR_ARGUMENT* subject, int bits,
                           const std::string& aliases, const std::string& dir);

// genCertSet with a server key of `type` (`bits` counts for kRsa only);
// for kRsa it is genCertSet. An EC server certificate's key usage is
// digitalSignature alone (ServerKeyUsage::kSignatureOnly).
ZEPH_EXPORT int genCertSetOfType(_tag_CSR_ARGUMENT* subject,
                                 ZEPH::cert::KeyType type, int bits,
                                 const std::string& aliases,
                                 const std::string& dir);

// Makes a whole set in `dir` with the appliance's default subjects: the
// authority "Arvelon Inc. CA" and the server "arvelon" (country TW, city
// Taipel, organization "Arvelon Inc."), 2048-bit keys, alias "arvelon".
ZEPH_EXPORT int genDefaultCrt(std::string dir);

#endif  // ZEPH_MODULE_MKCERT_CERT_SET_H_

// Certificate signing requests: made from a typed-in subject, renewed from
// an existing certificate, and signed with the authority of a certificate
// directory. The products go to the CSR work directory
// "/usr/zeph/etc/ssl/.gen", from which the export method hands them out.
//
// Thread-safety: the work files are shared by every generation; making a
// request (generateCSR) and signing hold the generation lock
// (module/mkcert/generation_lock.h) while they use them.
#ifndef ZEPH_MODULE_METHODS_CSR_H_
#define ZEPH_MODULE_METHODS_CSR_H_

#include "module/mkcert/csr_argument.h"
#include "module/mkcert/key_type.h"
#include "zeph/api.h"
#include "zeph/export.h"

// The placeholder subject values used when a request leaves them out.
constexpr char kDefaultCommonName[] = "nas.example.com";
constexpr char kDefaultEmail[] = "admin@example.com";
constexpr char kDefaultCaEmail[] = "admin@ca.example.com";

// Fills the seven fields of `subject` from the request's subject parameters
// ("country" ... "email", or "ca_country" ... "ca_email" when `is_ca`), with
// the defaults for absent ones. 0 on success; -1 when `subject` is null.
ZEPH_EXPORT int fillCSRInfo(ZEPH::APIRequest* request,
                            _tag_CSR_ARGUMENT* subject, bool is_ca);

// Makes a `bits`-bit RSA key ".gen/server.key" and a request
// ".gen/server.csr" for `subject`, holding the generation lock. True on
// success.
ZEPH_EXPORT bool generateCSR(int bits, _tag_CSR_ARGUMENT& subject);

// generateCSR with a key of `type` (`bits` counts for kRsa only).
bool generateCSROfType(ZEPH::cert::KeyType type, int bits,
                       _tag_CSR_ARGUMENT& subject);

// The optional key type parameter `name` of CRT create and CSR create and
// renew into `out`: absent leaves `out` alone; "rsa", "ec256" or "ec384"
// set it. False, with the log line "Invalid key type [<value>]", for any
// other value (a text or not).
bool KeyTypeParam(ZEPH::APIRequest* request, const char* name,
                  ZEPH::cert::KeyType* out);

#endif  // ZEPH_MODULE_METHODS_CSR_H_

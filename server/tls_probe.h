// What a new TLS connection to the server is presented: the check that a
// reloaded nginx serves the certificate it was given.
//
// Thread-safety: plain function; safe from any thread.
#ifndef ZEPH_SERVER_TLS_PROBE_H_
#define ZEPH_SERVER_TLS_PROBE_H_

#include <string>

namespace ZEPH {
namespace webapid {

// Connects to `host`:`port` (a numeric address; the wildcard addresses
// are reached through the loopback), completes a TLS handshake without
// verifying anything and returns the SHA-256 fingerprint of the leaf
// presented (CertificateFingerprint's form). Empty when no handshake
// completed within `timeout_ms`.
std::string PresentedFingerprint(const std::string& host, int port,
                                 int timeout_ms);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_TLS_PROBE_H_

// The server's access token.
//
// Every call of the web API carries "Authorization: Bearer <token>". The
// token is made on the server's first start: 32 random bytes written as 64
// lowercase hexadecimal digits and a line feed into a file of mode 0600
// (<root>/usr/zeph/etc/webapid/token). Later starts read the same file, so
// the page and scripts keep signing in with it.
//
// Thread-safety: LoadOrCreateToken runs once at start-up; TokenAccepts only
// reads its arguments and may be called from any thread.
#ifndef ZEPH_SERVER_TOKEN_H_
#define ZEPH_SERVER_TOKEN_H_

#include <string>

namespace ZEPH {
namespace webapid {

// Where the token lives, below the root prefix.
constexpr char kTokenFile[] = "/usr/zeph/etc/webapid/token";

// Reads the token at `path`, making it first when the file does not exist
// (created whole, by a link, so two servers starting together agree on one
// token). A file that exists must hold one token of at least 32 printable
// characters; its mode is tightened to 0600 when group or others could read
// it. False with a one-line reason in `error` otherwise.
bool LoadOrCreateToken(const std::string& path, std::string* token,
                       std::string* error);

// Whether the value of an Authorization header carries `token` with the
// Bearer scheme (the scheme name in any case). The comparison of the token
// takes the same time wherever the first difference lies.
// REQUIRES: `token` is not empty.
bool TokenAccepts(const std::string& authorization, const std::string& token);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_TOKEN_H_

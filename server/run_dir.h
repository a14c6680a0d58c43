// The server's run directory, <root>/run/zeph-webapid, and the user nginx's
// workers run as.
//
//   lock           held (flock) by the one zeph-webapid serving the root
//   nginx.conf     nginx's configuration, written at each start
//   nginx.pid      nginx's master process
//   tls/           (0700) the checked copy of the certificate nginx loads
//   api/           the private socket of zeph-webapid's own listener:
//                  mode 0750 and group of the worker user when started as
//                  root, else 0700, so no other local user can enter it
//   body/, proxy/, fastcgi/, uwsgi/, scgi/
//                  nginx's temporary files (request bodies being received)
//
// Prepare sweeps what a killed run left behind: nginx's temporary files
// (half-received uploads, possibly private keys), the old socket and copy,
// and the upload directories zeph-webapid made for calls
// (<root>/tmp/zeph-webapid-upload.*). It holds the lock from then on, so
// it never sweeps under a running server.
//
// Thread-safety: used by main before any thread starts.
#ifndef ZEPH_SERVER_RUN_DIR_H_
#define ZEPH_SERVER_RUN_DIR_H_

#include <sys/types.h>

#include <string>

#include "zeph/unique_fd.h"

namespace ZEPH {
namespace webapid {

// Where the run directory lives, below the root prefix.
constexpr char kRunDir[] = "/run/zeph-webapid";

// Who nginx's workers run as.
struct WorkerUser {
  std::string name;  // empty: the server's own user (not started as root)
  uid_t uid = 0;
  gid_t gid = 0;
};

// Started as root: the unprivileged user "www-data". Otherwise the
// process's own user, with an empty name. False with a reason in `error`
// when the user does not exist.
bool FindWorkerUser(WorkerUser* user, std::string* error);

// The first directory on the way to `path` (`path` itself included) that
// `user` may not enter, or a file it may not read when `path` is one;
// empty when everything can be reached. The check follows the mode bits
// and owners, as the kernel would for the user without extra groups.
std::string BlockedFor(const WorkerUser& user, const std::string& path);

class RunDir {
 public:
  explicit RunDir(std::string dir) : dir_(std::move(dir)) {}

  // Makes the directory (mode 0755), takes the lock and sweeps what an
  // earlier run left: below the directory and, in `upload_parent`, every
  // "zeph-webapid-upload.*". False with a reason in `error`, also when
  // another server holds the lock.
  bool Prepare(const WorkerUser& user, const std::string& upload_parent,
               std::string* error);

  const std::string& dir() const { return dir_; }
  std::string Path(const char* name) const { return dir_ + "/" + name; }
  std::string api_socket() const { return dir_ + "/api/api.sock"; }

 private:
  std::string dir_;
  UniqueFd lock_;
};

// Removes `path` and, for a directory, everything below it; a missing path
// is fine. Symbolic links are removed, never followed.
bool RemoveTree(const std::string& path);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_RUN_DIR_H_

// Provisioning of an appliance root.
//
// Makes what the certificate module expects to find below the root prefix
// (ZEPH_ROOT): the directory tree of the archive, the service and hook
// directories, the key-generation work directories, the log and lock
// directories; a SERVICES file registering the web administration service;
// the feature switches; the certificate-making tool "/usr/zeph/bin/mkcert"
// and the Let's Encrypt tool "/usr/zeph/sbin/zeph-letsencrypt";
// and, below a private root, the network address file that an appliance's
// kernel would provide.
//
// Existing files are never overwritten: provisioning a root twice changes
// nothing the first run or an administrator wrote. The one exception is a
// tool: a copy that provisioning installed itself and that nobody changed
// since is refreshed when the built tool differs (a rebuild), so that a
// root keeps working with the executables that provision it.
#ifndef ZEPH_HOST_PROVISION_H_
#define ZEPH_HOST_PROVISION_H_

#include <string>

namespace ZEPH {

// Provisions the root that ZEPH_ROOT names. On failure returns false with a
// one-line reason in `error`.
bool ProvisionRoot(std::string* error);

// The name of the user the process runs as (its effective uid); "root"
// when the user database has none.
std::string CurrentUserName();

// The service object of the web administration interface, owned by `owner`.
std::string WebServiceJson(const std::string& owner);

// Installs the built tool at `source` as `target` (mode 0755). Nothing
// happens when `source` is empty or missing, when `target` is `source`
// itself, or when `target` holds the same bytes. A different `target` is
// replaced only when it is the unchanged copy of an earlier installation,
// as recorded in the hidden file ".<name>.provisioned" beside it; any
// other file there is left alone. The copy appears whole, by a rename.
// False with a one-line reason in `error` when the tool cannot be read or
// written.
bool InstallTool(const std::string& source, const std::string& target,
                 std::string* error);

// Where the built tool `name` is for the running executable: beside it
// (the build tree, or an installed tree's bin), else in ../bin or ../sbin.
// Empty when none exists.
std::string FindBuiltTool(const std::string& name);

// Twelve lowercase hexadecimal digits of the first network interface's
// hardware address (loopback and all-zero addresses skipped), or twelve
// zeros when there is none.
std::string FirstHardwareAddress();

}  // namespace ZEPH

#endif  // ZEPH_HOST_PROVISION_H_

// Provisioning of an appliance root.
//
// Makes what the certificate module expects to find below the root prefix
// (ZEPH_ROOT): the directory tree of the archive, the service and hook
// directories, the key-generation work directories, the log and lock
// directories; a SERVICES file registering the web administration service;
// the feature switches; and, below a private root, the network address file
// that an appliance's kernel would provide.
//
// Existing files are never overwritten: provisioning a root twice changes
// nothing the first run or an administrator wrote.
#ifndef ZEPH_HOST_PROVISION_H_
#define ZEPH_HOST_PROVISION_H_

#include <string>

namespace ZEPH {

// Provisions the root that ZEPH_ROOT names. On failure returns false with a
// one-line reason in `error`.
bool ProvisionRoot(std::string* error);

// The service object of the web administration interface, owned by `owner`.
std::string WebServiceJson(const std::string& owner);

// Twelve lowercase hexadecimal digits of the first network interface's
// hardware address (loopback and all-zero addresses skipped), or twelve
// zeros when there is none.
std::string FirstHardwareAddress();

}  // namespace ZEPH

#endif  // ZEPH_HOST_PROVISION_H_

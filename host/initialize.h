// First start of an appliance root: provision it and, when its catalogue
// does not exist yet, reset the store so that a default certificate exists
// and every registered service is bound to it. Shared by zephcert init and
// the web API server.
#ifndef ZEPH_HOST_INITIALIZE_H_
#define ZEPH_HOST_INITIALIZE_H_

#include <string>

#include "host/module_loader.h"

namespace ZEPH {

// Provisions the root that ZEPH_ROOT names (see provision.h) and, when it
// has no INFO file, calls the module's "reset" method. On failure returns
// false with a one-line reason in `error`.
bool InitializeRoot(const LoadedModule& module, std::string* error);

}  // namespace ZEPH

#endif  // ZEPH_HOST_INITIALIZE_H_

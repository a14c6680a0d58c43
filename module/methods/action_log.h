// The action log: every user-visible change to a certificate is recorded in
// the appliance's event log (ZEPHLogSet1) as a message id with the
// certificate's display name, never as free text.
//
// Thread-safety: safe from any thread and process; the event log serialises
// its writers.
#ifndef ZEPH_MODULE_METHODS_ACTION_LOG_H_
#define ZEPH_MODULE_METHODS_ACTION_LOG_H_

#include <string>

#include "zeph/export.h"

// The recorded actions. The values are fixed: they select the message ids.
enum CERT_ACTION {
  CERT_ACTION_SET_DEFAULT = 0,  // a certificate made the default
  CERT_ACTION_CREATE = 1,       // a new certificate made (create, import, LE)
  CERT_ACTION_REPLACE = 2,      // an existing certificate's files replaced
  CERT_ACTION_DELETE = 3,
  CERT_ACTION_SERVICE_SET = 4,  // a service bound to a certificate
  CERT_ACTION_RECREATE = 5,
  CERT_ACTION_RESET = 6,
};

// Records `action` with its outcome. The display name is the subject common
// name of certificate `id` when it can be read, else `name`. `extra` is the
// second text of the service-assignment action and ignored for the others.
// Failures of creation and replacement (actions 1 and 2) are not recorded,
// nor is any action value of 7 or more. Never fails its caller.
ZEPH_EXPORT void LogAction(CERT_ACTION action, bool success,
                           const std::string& id, const std::string& name,
                           const std::string& extra);

// The subject common name of the archive's certificate `id`; empty when the
// id is not a valid certificate, its "cert.pem" cannot be read, or its
// subject has no common name.
ZEPH_EXPORT std::string GetCrtSubjectCN(const std::string& id);

#endif  // ZEPH_MODULE_METHODS_ACTION_LOG_H_

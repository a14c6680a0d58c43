// Base class of the handlers that take uploaded forms and answer downloads.
//
// A form handler is made on the stack for one request. The platform's
// generic path calls Process, which authenticates, takes the handler's lock
// and runs HandleLoadAction (a read) or HandleApplyAction (a change);
// derived classes may also be called directly, as the certificate module's
// wrappers do.
//
// The virtual operations are declared in the order that fixes their slots:
// Process, HandleLoadAction, HandleApplyAction, the destructor, ExLock,
// ShLock, Authenticate.
//
// The lock is a lock file "<root>/tmp/<lock_name>.lock" taken shared
// (ShLock) or exclusive (ExLock) with a 30-second time-out and released by
// the destructor. Thread-safety: one object per request and thread.
#ifndef ZEPH_SERVER_FORM_HANDLER_H_
#define ZEPH_SERVER_FORM_HANDLER_H_

#include <string>

#include "zeph/api.h"
#include "zeph/export.h"

class ZEPH_EXPORT ServerFormHandler {
 public:
  // `need_auth`: whether Process must authenticate first. `lock_name`: name
  // of the handler's lock file, or null for none.
  ServerFormHandler(bool need_auth, const char* lock_name);
  ServerFormHandler(const ServerFormHandler&) = delete;
  ServerFormHandler& operator=(const ServerFormHandler&) = delete;

  // Generic entry: Authenticate (when needed); then, for a request with the
  // parameter "action" equal to "apply", ExLock and HandleApplyAction, else
  // ShLock and HandleLoadAction. A failed authentication or lock answers
  // error 5501. Returns whether the work ran.
  virtual bool Process(ZEPH::APIRequest* request, ZEPH::APIResponse* response);
  // The read and change work of a derived class. The base answers 5501.
  virtual void HandleLoadAction(ZEPH::APIRequest* request,
                                ZEPH::APIResponse* response);
  virtual void HandleApplyAction(ZEPH::APIRequest* request,
                                 ZEPH::APIResponse* response);
  virtual ~ServerFormHandler();
  // Take the handler's lock; true when held (or when there is no lock name).
  virtual bool ExLock();
  virtual bool ShLock();
  // The server authenticates every call before any handler runs, so the
  // base class accepts.
  virtual bool Authenticate(ZEPH::APIRequest* request);

 protected:
  bool need_auth() const { return need_auth_; }

 private:
  bool Lock(int mode);

  bool need_auth_;
  std::string lock_name_;
  int lock_fd_ = -1;
};

#endif  // ZEPH_SERVER_FORM_HANDLER_H_

// The effective identity of the process, switched for a scope.
#ifndef COMMON_SDK_CREDENTIALS_H_
#define COMMON_SDK_CREDENTIALS_H_

#include <sys/types.h>

#include <string>

#include "common/export.h"

namespace vexlo::sdk {

// Makes the process another user and, at the end of the scope, sees to it that it is the user whom
// the object names. The two constructors differ in who that is, and callers rely on it:
//
//   SDKCredentials user;          names the effective user that it finds. user.AsUser("root") ...
//                                 and at the end of the scope the process is that user again.
//   SDKCredentials root("root");  names "root", and makes the process so. At the end of the scope
//                                 nothing goes back: a process that was someone else stays root.
//
// The identity belongs to the process: every thread changes with it. SDKMutex() is held around each
// platform call, never in between. So a program with several threads has one of these at a time.
class VEXLO_EXPORT SDKCredentials {
 public:
  // Throws Error 503 when the effective user is not known to the platform.
  SDKCredentials();

  // Throws as AsUser() does.
  explicit SDKCredentials(const std::string& user);

  // Where the effective ids are no longer those that the object found, becomes the user it names. A
  // failure is logged.
  ~SDKCredentials();
  SDKCredentials(const SDKCredentials&) = delete;
  SDKCredentials& operator=(const SDKCredentials&) = delete;

  // Makes the process `user`, or root when `user` is one of the administrators. Throws Error 503.
  void AsUser(const std::string& user);

 private:
  uid_t euid_;
  gid_t egid_;
  std::string username_;
};

}  // namespace vexlo::sdk

#endif  // COMMON_SDK_CREDENTIALS_H_

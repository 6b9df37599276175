#include "kavo/service.h"

#include <sys/stat.h>
#include <syslog.h>

#include <cerrno>
#include <string>

#include "kavo/exec.h"
#include "kavo/local/shares.h"
#include "platform/local/boundary.h"

using kavo::local::SetLastError;

namespace {

// There as long as systemd is the system's manager.
constexpr char kSystemdFolder[] = "/run/systemd/system";

bool HasServiceManager() {
  struct stat info {};
  // A build with a root of its own leaves the machine's services alone.
  return kavo::local::Root().empty() && stat(kSystemdFolder, &info) == 0 && S_ISDIR(info.st_mode);
}

// The error for an exit status of systemctl.
int ErrorOf(int exit_status) {
  switch (exit_status) {
    case 4:
      return EACCES;
    case 5:
      return ENOENT;  // No such service.
    default:
      return EIO;
  }
}

int Control(const char* verb, const char* name) {
  return kavo::local::Guarded([verb, name] {
    if (!HasServiceManager()) {
      syslog(LOG_NOTICE, "kavoplatform: no service manager here, nothing done to %s service %s",
             verb, name);
      return 0;
    }
    const std::string unit = std::string(name) + ".service";
    const int status = KLIBCExec("/bin/systemctl", "--no-ask-password", "--no-block", verb, "--",
                                 unit.c_str(), nullptr);
    if (status > 0) {
      errno = ErrorOf(status);
      return SetLastError(KAVO_ERR_SYSTEM);
    }
    return status;
  });
}

}  // namespace

int KLIBServicectlStart(const char* name) { return Control("start", name); }

int KLIBServicectlStop(const char* name) { return Control("stop", name); }

int KLIBServiceStart(const char* name) { return Control("start", name); }

int KLIBServiceRestart(const char* name) { return Control("restart", name); }

int KAVOSMBSetSpotlight(const char* share_name, int is_on) {
  syslog(LOG_NOTICE, "kavoplatform: no SMB server here, search is not switched %s for share %s",
         is_on != 0 ? "on" : "off", share_name);
  return 0;
}

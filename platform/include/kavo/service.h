// The platform's services. Each returns 0, or a negative number with errno when the service manager
// refuses. The manager is not waited for, as callers may hold locks that the service wants while it
// starts or ends: 0 means that it will be done. Where no service manager runs there is nothing to
// do: one line in the system log, and 0.
#ifndef KAVO_SERVICE_H_
#define KAVO_SERVICE_H_

#ifdef __cplusplus
extern "C" {
#endif

// Services of packages, by name: "pkg-Vexlo-fileindexd". Starting one that runs and stopping one
// that does not change nothing.
int KLIBServicectlStart(const char* name);
int KLIBServicectlStop(const char* name);

// Services of the platform itself, by name: "kavocontentextractd".
int KLIBServiceStart(const char* name);
int KLIBServiceRestart(const char* name);

// Switches whether clients may search a share over SMB. The local platform has no SMB server of its
// own: one line in the system log, and 0.
int KAVOSMBSetSpotlight(const char* share_name, int is_on);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // KAVO_SERVICE_H_

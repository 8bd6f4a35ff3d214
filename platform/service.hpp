// Running programs and controlling services: QLIBCExecl runs a program without a shell; the
// service calls go through systemd when it runs (the folder run/systemd/system exists, and
// usr/bin/systemctl, both under ORVANE_ROOT) and otherwise through the start, stop and restart
// commands that the platform configuration names per service; the file-sharing search setting
// is Samba's "spotlight" option when Samba's configuration file exists. Results: negative on
// failure with errno and QLIBCErrGet() set. Safe from any thread.
#ifndef ORVANE_PLATFORM_SERVICE_HPP_
#define ORVANE_PLATFORM_SERVICE_HPP_

namespace orvane {
namespace platform {

#ifndef TRUE
constexpr int TRUE = 1;
#endif
#ifndef FALSE
constexpr int FALSE = 0;
#endif

// Execution flags of QLIBCExecl.
constexpr int QLIBC_EXEC_WAIT = 0x01;         // wait and return the exit status
constexpr int QLIBC_EXEC_STDIN_NULL = 0x02;   // standard input from /dev/null
constexpr int QLIBC_EXEC_SEARCH_PATH = 0x04;  // look a bare program name up in PATH
constexpr int QLIBC_EXEC_STDOUT_NULL = 0x08;
constexpr int QLIBC_EXEC_STDERR_NULL = 0x10;
constexpr int QLIBC_EXEC_CLOSE_FDS = 0x20;    // the child inherits no other descriptor
constexpr int QLIBC_EXEC_NEW_SESSION = 0x80;  // the child leaves the caller's session

// Runs `path` with the arguments that follow (const char*, ended by nullptr; the program name
// is passed as argv[0] by the call itself). With QLIBC_EXEC_WAIT: the exit status (0-255), or
// 128 + signal number when a signal ended it; otherwise the child's pid. -1 when the program
// could not be started.
int QLIBCExecl(const char* path, int flags, ...);

// Flags of the service-manager calls.
constexpr int QLIB_SERVICECTL_UPSTART = 0x01;

// 0 once the service is started (restarted, stopped); -1 when the service manager or the
// configured command failed, or no command is configured (ENOENT, kQErrNotSupported).
int QLIBServiceStart(const char* name, int wait);
int QLIBServiceRestart(const char* name);
int QLIBServicectlStart(const char* name, int flags);
int QLIBServicectlStop(const char* name, int flags);

// 1 when Samba's "spotlight" option is on in its [global] section, 0 when it is off or Samba is
// not installed, -1 when the file cannot be read.
int QUIXSMBIsEnableSpotlight();
// Sets the option (replacing the file atomically); -1 when Samba is not installed
// (ENOENT, kQErrNotSupported) or the file cannot be written.
int QUIXSMBSetSpotlight(int enable);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_SERVICE_HPP_

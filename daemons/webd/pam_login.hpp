// Checks an account's password through PAM with the daemon's own service file, so the server's
// accounts (and whatever PAM stack the administrator chose) decide who may sign in. Stateless;
// safe from any thread (each call has its own PAM handle).
#ifndef ORVANE_DAEMONS_WEBD_PAM_LOGIN_HPP_
#define ORVANE_DAEMONS_WEBD_PAM_LOGIN_HPP_

#include <string>

namespace orvane {
namespace webd {

struct PamService {
  std::string name = "fileindex-web";
  std::string dir;  // the folder holding the service file; empty: the system's (/etc/pam.d)
};

// True when `password` is the account's and the account may be used now; otherwise false with
// the PAM module's reason in *why (for the log, never for the client).
bool PamAuthenticate(const PamService& service, const std::string& user,
                     const std::string& password, std::string* why);

}  // namespace webd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_WEBD_PAM_LOGIN_HPP_

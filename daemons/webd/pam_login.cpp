#include "daemons/webd/pam_login.hpp"

#include <security/pam_appl.h>

#include <cstdlib>
#include <cstring>
#include <memory>

namespace orvane {
namespace webd {
namespace {

// Answers every prompt for a secret with the password and every other prompt with the name.
int Converse(int count, const struct pam_message** messages, struct pam_response** responses,
             void* data) {
  const auto* credentials = static_cast<const std::pair<std::string, std::string>*>(data);
  auto* answers = static_cast<pam_response*>(std::calloc(count, sizeof(pam_response)));
  if (answers == nullptr) return PAM_BUF_ERR;
  for (int i = 0; i < count; ++i) {
    const int style = messages[i]->msg_style;
    if (style == PAM_PROMPT_ECHO_OFF) {
      answers[i].resp = ::strdup(credentials->second.c_str());
    } else if (style == PAM_PROMPT_ECHO_ON) {
      answers[i].resp = ::strdup(credentials->first.c_str());
    }
  }
  *responses = answers;
  return PAM_SUCCESS;
}

// The modules' own delay after a failure would hold a server thread for seconds; the daemon
// limits attempts itself.
void NoDelay(int, unsigned, void*) {}

}  // namespace

bool PamAuthenticate(const PamService& service, const std::string& user,
                     const std::string& password, std::string* why) {
  const std::pair<std::string, std::string> credentials(user, password);
  const pam_conv conversation = {Converse,
                                 const_cast<std::pair<std::string, std::string>*>(&credentials)};
  pam_handle_t* raw = nullptr;
  int rc = pam_start_confdir(service.name.c_str(), user.c_str(), &conversation,
                             service.dir.empty() ? nullptr : service.dir.c_str(), &raw);
  if (rc != PAM_SUCCESS) {
    *why = "cannot start PAM for service " + service.name + ": " + pam_strerror(raw, rc);
    if (raw != nullptr) pam_end(raw, rc);
    return false;
  }
  const auto end = [&rc](pam_handle_t* h) { pam_end(h, rc); };
  const std::unique_ptr<pam_handle_t, decltype(end)> handle(raw, end);
  pam_set_item(raw, PAM_FAIL_DELAY, reinterpret_cast<const void*>(&NoDelay));
  rc = pam_authenticate(raw, PAM_DISALLOW_NULL_AUTHTOK);
  if (rc == PAM_SUCCESS) rc = pam_acct_mgmt(raw, PAM_DISALLOW_NULL_AUTHTOK);
  if (rc != PAM_SUCCESS) *why = pam_strerror(raw, rc);
  return rc == PAM_SUCCESS;
}

}  // namespace webd
}  // namespace orvane

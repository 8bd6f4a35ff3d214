// Test-only: a minimal client of the daemon's framing and a scoped daemon process, so that the
// tests talk to the real daemon through its real socket. Not thread-safe.
#ifndef ORVANE_TEST_ENGINE_CLIENT_HPP_
#define ORVANE_TEST_ENGINE_CLIENT_HPP_

#include <sys/types.h>

#include <json/json.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "common/wire.hpp"

namespace orvane {
namespace elasticd {
namespace tc {

// Sends raw bytes to the socket and returns the raw reply payload ("" when the daemon closed
// the connection without a reply).
std::string RawExchange(const std::string& socket, const std::string& bytes);
// One request frame (JSON text + NUL) and its parsed reply; null on a closed connection.
Json::Value Request(const std::string& socket, const Json::Value& request);
// As Request(), from a child process running as `uid`/`gid`.
Json::Value RequestAs(const std::string& socket, const Json::Value& request, uid_t uid, gid_t gid);
std::string Frame(const std::string& payload);

// The daemon binary run in the foreground under a scratch ORVANE_ROOT.
class DaemonProcess {
 public:
  DaemonProcess(const std::string& root, std::vector<std::string> extra_args = {});
  ~DaemonProcess();
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  // Waits until the socket answers; false after ~10 s.
  bool WaitReady();
  // Sends a signal and waits for the exit; returns the wait status.
  int Signal(int sig);
  pid_t pid() const { return pid_; }
  std::string socket() const { return root_ + kElasticdSockPath; }
  std::string public_socket() const { return root_ + kElasticdSearchSockPath; }

 private:
  std::string root_;
  pid_t pid_ = -1;
};

// Polls `pred` every 25 ms for up to ten seconds; its last answer.
bool Eventually(const std::function<bool()>& pred);

// A request {"command": command, "data": data}.
Json::Value Cmd(const std::string& command, const Json::Value& data);
// A request {"command": command, "data": {"id": id}}.
Json::Value OnIndex(const std::string& command, const std::string& id = "fileindex_share");
// JSON text parsed; null (and a test failure) when it does not parse.
Json::Value Parse(const std::string& text);
// {"compound": requests}.
Json::Value Compound(const std::vector<Json::Value>& requests);
// A file's document as the library writes it, its names and parents taken from the path.
Json::Value FileDoc(const std::string& path, int64_t size = 1, int64_t mtime = 0);
// document_upsert_by_id of FileDoc(path, size, mtime) into index `id`.
Json::Value Upsert(const std::string& path, const std::string& id = "fileindex_share",
                   int64_t size = 1, int64_t mtime = 0);
// The schema the library sends at index creation, reduced to the fields the tests use.
Json::Value FileMappings();

}  // namespace tc
}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_TEST_ENGINE_CLIENT_HPP_

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
#include "test/test_util.hpp"

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

// The daemon binary run in the foreground under a scratch ORVANE_ROOT, as a service user that
// does not exist.
class DaemonProcess {
 public:
  DaemonProcess(const std::string& root, std::vector<std::string> extra_args = {});

  // Waits until the socket answers; false after ~10 s.
  bool WaitReady();
  // Sends a signal and waits for the exit; returns the wait status.
  int Signal(int sig) { return process_.Signal(sig); }
  pid_t pid() const { return process_.pid(); }
  std::string socket() const { return root_ + "/var/run/quixelasticd.sock"; }
  std::string public_socket() const { return root_ + "/var/run/quixelasticd.search.sock"; }

 private:
  static std::vector<std::string> Argv(std::vector<std::string> extra_args);

  std::string root_;
  orvane::test::ChildProcess process_;
};

// Polls `pred` for up to ten seconds; its last answer.
inline bool Eventually(const std::function<bool()>& pred) {
  return orvane::test::WaitFor(pred, 10000);
}

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

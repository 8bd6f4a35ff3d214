// IndexDaemon is the indexing daemon's core: one Worker per indexed share that is not paused,
// the global pause, and the answers to the commands of its socket. Commands may come from the
// server thread while the main thread reloads; one mutex guards the worker table.
#ifndef ORVANE_DAEMONS_FILEINDEXD_INDEX_DAEMON_HPP_
#define ORVANE_DAEMONS_FILEINDEXD_INDEX_DAEMON_HPP_

#include <sys/types.h>
#include <json/json.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>

#include "common/wire.hpp"
#include "daemons/fileindexd/worker.hpp"

namespace orvane {
namespace fileindexd {

constexpr char kFileIndexdPidPath[] = "/var/run/fileindexd.pid";

// Root, the daemon's own user and members of the platform's administrators group: the callers
// who see the details of files in the status (the text of the last errors).
bool IsPrivilegedCaller(uid_t uid);

class IndexDaemon {
 public:
  IndexDaemon();
  ~IndexDaemon();
  IndexDaemon(const IndexDaemon&) = delete;
  IndexDaemon& operator=(const IndexDaemon&) = delete;

  // Reads the pause from the status file and starts the workers the folder file calls for.
  void Start();
  // Stops every worker; unfinished batches stay queued for the next start.
  void StopAll();
  // Starts workers for newly indexed shares and stops those of shares no longer indexed.
  void Reload();

  // Answers one command ({"type", "data"}) from the caller `peer_uid`. Control commands are
  // refused (kCodePermissionDenied) to anyone but root and the daemon's own user; "status" is
  // for everyone, with the details of files only for privileged callers.
  Json::Value Handle(const Json::Value& command, uid_t peer_uid);

  // Queues a reconciliation of every indexed folder of every share, for a start after an
  // unclean stop. Failures are logged (and the share flagged for re-index), never thrown.
  static void ReconcileAll();

  bool IsPaused() const;
  std::set<std::string> running_shares() const;

 private:
  // The indexed shares, and those whose folders are all paused.
  static void ReadShares(std::set<std::string>* indexed, std::set<std::string>* paused);
  void StartWorker(const std::string& share);
  void StopWorker(const std::string& share);
  Json::Value Status(bool details) const;

  std::atomic<long long> resume_time_{-1};
  mutable std::mutex mu_;
  std::map<std::string, std::unique_ptr<Worker>> workers_;
};

}  // namespace fileindexd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_FILEINDEXD_INDEX_DAEMON_HPP_

// Registration of event queues with the file-change daemon (quixnotifyd).
//
// Each registration is one JSON file in the folder $ORVANE_ROOT/var/lib/quixnotifyd/queues,
// named "<app>.<type>.<16 hex digits of a hash of the queue path>.json" and holding the record
// as given ({"queue": path, "config": [{"path", "mask", "ignore"}...]}) plus "app" and "type".
// Files are replaced atomically, so the daemon never reads half a record; the daemon watches the
// folder and re-reads it on every change, so a running daemon follows a registration at once and
// a daemon started later finds it. Safe from any thread.
#ifndef ORVANE_PLATFORM_MONITOR_QUEUE_HPP_
#define ORVANE_PLATFORM_MONITOR_QUEUE_HPP_

#include <json/json.h>

#include <string>
#include <vector>

namespace QUIX {
namespace QUIXNOTIFYD {

enum MonitorQueueType {
  MONITOR_QUEUE_TYPE_SYSTEM = 1,
  MONITOR_QUEUE_TYPE_APPLICATION = 2,
};

// The fixed folder of the registrations, resolved through ORVANE_ROOT where used.
extern const char kRegistrationDir[];

class MonitorQueue {
 public:
  // Registers `record` for `app`, replacing an earlier registration of the same queue and app.
  // False (errno EINVAL) for a record without an absolute "queue" or with a "config" entry
  // lacking an absolute "path", a "mask" or an "ignore" array of strings; false when it cannot
  // be stored.
  static bool Upsert(const Json::Value& record, const std::string& app, MonitorQueueType type);
  // Removes the registration of `queue_path` for `app`; one that does not exist is removed.
  static bool Delete(const std::string& queue_path, const std::string& app, MonitorQueueType type);
  // Every stored registration that is well-formed, in file-name order (the daemon's view).
  static std::vector<Json::Value> List();
};

}  // namespace QUIXNOTIFYD
}  // namespace QUIX

#endif  // ORVANE_PLATFORM_MONITOR_QUEUE_HPP_

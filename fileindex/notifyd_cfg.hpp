// The services that the administration operations share: registering a share's event queue
// with the file-change daemon, appending the library's own events to a share's queue, and
// switching on or off the services that indexing depends on. Free functions with no state of
// their own; queue appends serialise on the queue's lock file, nothing else locks.
#ifndef ORVANE_FILEINDEX_NOTIFYD_CFG_HPP_
#define ORVANE_FILEINDEX_NOTIFYD_CFG_HPP_

#include <json/json.h>

#include <string>
#include <vector>

#include "fileindex/folder_mgr.hpp"
#include "fileindex/notify.hpp"

namespace orvane {
namespace fileindex {

// The application name under which queues are registered.
extern const char kAppName[];
// The change kinds the file-change daemon reports for every indexed folder.
constexpr int kMonitorMask = 0xFFCC;

// Registers `share`'s queue with every folder of `folders` in that share (an empty list when
// none). Error 502 "MonitorQueue::Upsert failed, share=<share>" when it cannot be stored.
void UpsertQUIXNotifydCfg(const std::string& share, FolderMgr& folders);
// Removes `share`'s registration. Error 502 "MonitorQueue::Delete failed, share=<share>".
void DeleteQUIXNotifydCfg(const std::string& share);

// Appends {"event", "path", "path_old", "data"} as one line to the queue of the share holding
// the full path `path`. Nothing is written for a share that cannot be indexed or below a
// re-index that is already queued. On failure the share is flagged for re-index in the status
// file and the Error is thrown on.
void AddCustomEvent(int event, const std::string& path, const std::string& path_old,
                    const Json::Value& data);

// One event for AddCustomEvents.
struct CustomEvent {
  int event;
  std::string path;
  std::string path_old;
  Json::Value data;
};
// AddCustomEvent for each event in order, with each share's queue read once and each share's
// lines appended in one locked write: an operation on many folders costs one pass over the
// queue instead of one per folder. A re-index in the batch makes later events below it
// redundant too. On the first failure the events gathered before it are still written.
void AddCustomEvents(const std::vector<CustomEvent>& events);

// The service switch: on, the file-sharing search integration, the content extraction service
// and the indexing daemon are started; off, the integration is turned off and the indexing
// daemon stopped. Failures are only logged.
void SetupRelatedServices(bool enable);
// The switch, on when the folder file names at least one folder.
void PrepareServices();

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_NOTIFYD_CFG_HPP_

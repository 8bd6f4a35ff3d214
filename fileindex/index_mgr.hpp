// The administration operations: what administrators and platform hooks call to decide what is
// indexed and to keep the folder file, the share indexes, the file-change daemon's queue
// registrations and the indexing daemon's workers in step. Free functions; each loads what it
// needs, changes it and saves it before returning, and reports failure only by throwing Error.
// Operations that change the folder file hold the folder lock file for their whole run, so
// processes may call them concurrently; steps after the save are not rolled back on failure.
#ifndef ORVANE_FILEINDEX_INDEX_MGR_HPP_
#define ORVANE_FILEINDEX_INDEX_MGR_HPP_

#include <json/json.h>

#include <string>

#include "fileindex/notifyd_cfg.hpp"
#include "platform/share.hpp"

namespace orvane {
namespace fileindex {

using platform::AUTH_TYPE;

// Share status flag owned by the volume operations: the share was paused with its volume.
constexpr int kShareStatusVolumePaused = 2;

// ---- Folders ----

// Adds the folders of `folder_list` (an array of folder records). Error 120 for a request that
// is not an array or a malformed record, 903 for a path that cannot be indexed (not checked in
// updater mode), 901 for a path already configured, 1003 for a share short of space: all before
// anything changes. Then each touched share that had no folder gets an index, every touched
// share's queue is registered, the file saved, the indexing daemon told, and (not in updater
// mode) a folder-settings event queued for each folder whose effective switches changed.
void FolderAdd(const Json::Value& folder_list, bool updater_mode);
// The same, replacing the records of configured paths (an unknown path is added).
void FolderSet(const Json::Value& folder_list, bool updater_mode);

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_INDEX_MGR_HPP_

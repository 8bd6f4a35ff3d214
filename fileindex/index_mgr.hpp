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

// Removes the folders of `path_list` (an array of configured share paths). Error 120 for a
// request that is not an array of strings, 902 for a path that is not configured: before
// anything changes. Each touched share's queue is registered again, or, for a share left with
// no folder, unregistered and its index deleted; the file is saved and the indexing daemon told;
// a folder that still lies under another indexed folder gets a folder-settings event with the
// switches whose setting changed for it; the services are switched off when no folder is left.
void FolderDelete(const Json::Value& path_list);
// Queues a re-index event for each folder of `path_list` (configured share paths, checked as
// for FolderDelete). A share all of whose folders are asked for gets its index rebuilt first,
// its re-index flag cleared, and its worker started again.
void FolderReindex(const Json::Value& path_list);

// The folder listing. `request` is an object with the optional members "offset" and "limit"
// (unsigned; no limit by default), "sort_by" ("name", "path", "document", "audio", "video",
// "photo"), "sort_direction" ("asc" or "desc"), "group" ("all", the default, or a group name;
// "" for the folders without a group), "keyword" (part of the name, case-blind) and
// "additional" (an array; "status" adds each folder's status). Returns {"folders": [...],
// "total": n}, total counting every match before paging. Error 120 for a member of the wrong
// type or an unknown additional.
Json::Value FolderList(const Json::Value& request);
// One folder's record, with the additionals of `additionals` (an array, as for FolderList).
// Error 902 for a path that is not configured.
Json::Value FolderGet(const std::string& path, const Json::Value& additionals);
// The distinct non-empty groups of the configured folders, sorted.
Json::Value FolderListGroups();
// An overview: {"folder_count", "resume_time", "paused", "shares": [{"share", "folder_count",
// "queue_length" (events waiting in the live queue and the batch being worked off), "status"
// (the share's flag bits), "need_reindex", "volume_paused", "queue_no_space" (its queue's volume
// is full), "watch_limit" (directories left unwatched)}]}, shares in name order.
Json::Value FolderSummary();
// Whether a configured folder still has indexing work: {"path", "text" (and "desc") as for the
// "status" additional, "pending" (the queue holds events at or below it)}. Error 902 for a path
// that is not configured.
Json::Value FolderGetProcessingStatus(const std::string& path);

// ---- Shares ----

// The share was renamed: folders follow, the index is re-keyed, and a rename event moves every
// document. Error 120 "Missing share_from" / "Missing share_to".
void ShareRename(const std::string& share_from, const std::string& share_to);
// The share's worker is stopped, its queue unregistered and its index paused; its folders are
// marked paused. Nothing happens for a share without folders.
void SharePause(const std::string& share);
// The mirror image of SharePause.
void ShareResume(const std::string& share);
// The share's index is deleted and created anew and the whole share queued for re-index.
void ShareRebuild(const std::string& share);
// A paused share is dropped from the index: its index data below `share_path`, its index and its
// folders are removed; the services go off when no folder is left.
void ShareClearPaused(const std::string& share, const std::string& share_path);
// A share that no folder indexes any more loses its index, registration and index data.
void ShareAutoClean(const std::string& share);
// Queues a re-index of the share's recycle bin when it exists.
void ShareCheckRecycle(const std::string& share);
// The share moved to `share_path_from`'s successor (the platform already reports its new
// folder): the index follows its database, the old queue's registration goes, the new queue is
// registered, a rename event re-paths every document, and the worker is started again. Error
// 120 "Missing share name" / "Missing share path". Nothing happens for a share without folders.
void ShareMigrate(const std::string& share, const std::string& share_path_from);
// Removes the share's queue files and index database folder as composed from `share_path`, and
// nothing outside them (no symbolic link is followed, no other file system entered). Error 120
// for an empty or relative `share_path`, 502 when something cannot be removed.
void CleanShareIndexData(const std::string& share, const std::string& share_path);

// ---- Volumes: every indexed share whose folder lies on the volume mounted at `volume` ----

// SharePause, and the share flagged kShareStatusVolumePaused. Error 120 "Missing volume path".
void VolumePause(const std::string& volume);
// ShareResume, and the flag cleared.
void VolumeResume(const std::string& volume);
// ShareClearPaused with the share's folder, and the share's flags dropped.
void VolumeClearPaused(const std::string& volume);

// ---- Users and homes ----

// Folders in user_from's home follow the user's new name, and a rename event moves the
// documents. Error 120 "Missing user_from" / "Missing user_to".
void UserRename(const std::string& user_from, const std::string& user_to);
// The folders in the home that UserRemember recorded for `uid` are deleted (FolderDelete) and
// the record dropped. Error 504 for an unreadable records file, 120 for a user never remembered.
void UserDelete(unsigned int uid);
// Records the user's home (as a share path) under the user id in the user records file. A user
// without a home service records nothing. Errors of the user look-up, 504, 505, 502.
void UserRemember(unsigned int uid);
// The users' home recycle bins of account source `auth` are queued for re-index, so that the
// recycle-bin rules apply again. A failed enumeration is only logged.
void HomeEnable(AUTH_TYPE auth);
void HomeDisable(AUTH_TYPE auth);

extern const char kFileIndexUserInfosPath[];

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_INDEX_MGR_HPP_

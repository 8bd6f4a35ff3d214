// StatusMgr holds the status file: the global pause of indexing (a resume time) and a small set
// of flag bits per share, and tells the indexing daemon when indexing is paused or resumed. A
// short-lived value: construct it (loading the file) at the start of an operation. Writers
// serialise on the status lock file; readers take no lock. Not thread-safe.
#ifndef ORVANE_FILEINDEX_STATUS_MGR_HPP_
#define ORVANE_FILEINDEX_STATUS_MGR_HPP_

#include <string>

#include "common/json_util.hpp"

namespace orvane {
namespace fileindex {

// Fixed paths, resolved through RootedPath() where opened.
extern const char kFileIndexStatusCfgPath[];
extern const char kStatusCfgLockPath[];

// Share flag: the share's index must be rebuilt.
constexpr int kShareStatusNeedReindex = 1;
// Share flag: the share's queue cannot be written for lack of space on its volume; changes are
// no longer queued one by one and the share's folders are reconciled once it can be written.
constexpr int kShareStatusQueueNoSpace = 4;
// Share flag: the inotify watch limit leaves directories of a folder of the share unwatched;
// the folder is reconciled periodically until every directory is watched.
constexpr int kShareStatusWatchLimit = 8;

class StatusMgr {
 public:
  // Loads the status file; a missing file leaves the document null, an unparsable one throws
  // Error 504.
  StatusMgr();
  ~StatusMgr() = default;
  StatusMgr(const StatusMgr&) = delete;
  StatusMgr& operator=(const StatusMgr&) = delete;

  // The stored resume time: -1 not paused, 0 paused with no end, else paused until then.
  // Throws Error 120 when the document is not an object (no status file).
  long long GetPauseInfo() const;
  // The flag bits of `share`, 0 when none are stored. Throws Error 120 when the document has no
  // "share" object.
  int GetShareStatus(const std::string& share) const;

  // Pauses indexing for `hours` (0: until resumed), saves, and sends "pause" to the indexing
  // daemon. Error 120 for a negative length, before anything is written.
  void Pause(int hours);
  // Clears the pause, saves, and sends "resume".
  void Resume();

  // Set, clear or drop a share's flag bits under the status lock, then save.
  void SetShareStatus(const std::string& share, int bits);
  void UnsetShareStatus(const std::string& share, int bits);
  void ClearShareStatus(const std::string& share);

  // Writes the document as root with mode 0644 (Error 505 / 502).
  void Save();

  // Writes an empty status file ({"share": {}}) under the status lock when there is none, so
  // that status questions and flags work on a system that never paused.
  static void CreateIfMissing();

  const Json::Value& data() const { return data_; }

 private:
  // The stored flags of `share`, read the way the setters read them.
  unsigned int StoredShareBits(const std::string& share) const;

  JsonValue data_;
};

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_STATUS_MGR_HPP_
